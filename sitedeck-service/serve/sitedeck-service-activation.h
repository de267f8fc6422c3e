// The socket-activation protocol, as systemd documents it for services
// (sd_listen_fds(3), sd_is_socket(3)): the listening sockets arrive as
// descriptors 3 and up, LISTEN_PID names the process they are meant for and
// LISTEN_FDS counts them. Reading it takes a few system calls; linking
// libsystemd for it cost the service about a floor's worth of start-up time
// per connection in libraries loaded (docs/performance.md), so it is read
// here. Same results as the library calls of the same names.
#pragma once

// The first passed descriptor.
constexpr int SDS_LISTEN_FDS_START = 3;

// The number of descriptors passed to this process (0 when none, or when the
// variables name another process), with close-on-exec set on each; a
// negative errno for a malformed count. With `unset_environment` the three
// LISTEN_ variables are removed, whatever the result.
int sds_listen_fds(int unset_environment);

// 1 when `fd` is an AF_UNIX socket of `type` (0: any), listening as asked
// (`listening` > 0 listening, 0 not, < 0 either) and, when `path` is given,
// bound to that NUL-terminated path; 0 when it is not; a negative errno when
// it cannot be examined.
int sds_is_socket_unix(int fd, int type, int listening, const char* path);
