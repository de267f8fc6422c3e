// What the data-pull tests share: the server list file written into the
// scratch root, the transfer stall setting, readers of the pull's state files
// and of stored icon pixels, and an initialize exchange over a real socket.
#pragma once

#include <string>
#include <vector>

struct ServerEntry {
  int id = 1;
  std::string base_url;
  int wait_time = 0;  // below 1000 ms: no pause between attempts
  int retry_count = 1;
  bool fall_back = false;
};

// Writes it to the server list file of the root named by $SITEDECK_ROOT.
bool write_server_list(const std::vector<ServerEntry>& servers);

// Sets the seconds after which a transfer that moves nothing is given up.
void set_stall_seconds(int seconds);

// Content of a file of the root named by $SITEDECK_ROOT, or "<none>".
std::string root_file_or_none(const char* fixed_path);

// Hex of the first pixel's 4 stored bytes (B,G,R,A) of the site; "NULL" when
// the site has no icon.
std::string first_pixel_hex(const std::string& url);

// One colour as the service stores it: "#RRGGBB" and alpha to "BBGGRRAA".
std::string bgra_hex(const char* rgb, const char* alpha = "FF");

struct InitializeReply {
  int ready = -1;     // status after the header
  int received = -1;  // status after the position
  int final = -1;     // the pull's result
};

// Runs command 1 on a connected socket: position, then the flag and, when
// `version` is given with flag 0, the version string (an empty one is sent
// as length 0). Reads are bounded by the connection's own time-out.
InitializeReply run_initialize(int fd, int cid, double latitude, double longitude, int flag,
                               const std::string* version);
// Sends command 1 up to the version and returns without reading the result.
bool send_initialize(int fd, int cid, double latitude, double longitude, int flag,
                     const std::string* version);
