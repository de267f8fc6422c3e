// The floor of the query benchmarks: a peer process on the same kind of
// socket (Unix stream) that does only what the transport itself demands. For
// a URL it reads the 12-byte header and answers the 48 bytes a 40-byte URL
// takes in one write; for an icon it copies 147456 bytes into an already
// mapped shared-memory object of its own and answers 16 bytes. The client
// side reads those replies (and, for the icon, copies the pixels out), so a
// service scenario divided by its floor is the cost of everything else:
// dispatch, database, allocation, and the library's way of reading.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <string>

#include "sitedeck-service-raii.h"

// The floor's shared-memory object, apart from the service's.
constexpr char kBenchFloorShmName[] = "/sitedeck_bench_floor";

class BenchEchoPeer {
 public:
  BenchEchoPeer() = default;
  // Closes the connection, reaps the peer and removes its object.
  ~BenchEchoPeer();
  BenchEchoPeer(const BenchEchoPeer&) = delete;
  BenchEchoPeer& operator=(const BenchEchoPeer&) = delete;

  // Starts the peer on a socket at `socket_path` and connects to it.
  bool start(const std::string& socket_path, size_t url_reply_bytes, size_t icon_bytes);
  // One URL exchange: header out, the whole reply in.
  bool url_round_trip();
  // One icon exchange: header out, 16 bytes in, the pixels copied to `out`.
  bool icon_round_trip(unsigned char* out);

 private:
  pid_t pid_ = -1;
  UniqueFd connection_;
  unsigned char* mapping_ = nullptr;
  size_t url_reply_bytes_ = 0;
  size_t icon_bytes_ = 0;
  std::string socket_path_;
};
