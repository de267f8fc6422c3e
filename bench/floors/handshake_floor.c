/* The floor of the start-up benchmark: the least a socket-activated process
 * can do for a connection, with nothing linked but libc. It accepts on the
 * passed descriptor 3, writes an 8-byte handshake {0, 1} and holds the
 * connection until the client closes it (so that its resident memory can be
 * read meanwhile), as the service does. */
#include <stdint.h>
#include <sys/socket.h>
#include <unistd.h>

int main(void) {
  int fd = accept(3, 0, 0);
  if (fd < 0) return 1;
  const int32_t handshake[2] = {0, 1};
  if (write(fd, handshake, sizeof handshake) != (ssize_t)sizeof handshake) return 1;
  char byte;
  while (read(fd, &byte, 1) > 0) {
  }
  return 0;
}
