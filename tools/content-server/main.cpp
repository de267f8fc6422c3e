// sitedeck-content-server: a local stand-in for the remote content server,
// for tests, benchmarks and the demo. It answers the signed item-list request
// from a catalogue file (or N synthesised sites), serves the icons it lists,
// and can be told to misbehave. Usage is in docs/stand-in-servers.md.
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <memory>
#include <string>

#include "content-server.h"
#include "stand-in-server.h"

namespace {

constexpr const char* kTool = "sitedeck-content-server";

// The catalogue copied beside the binary by the build, else the source copy.
std::string default_catalogue() {
  char exe[PATH_MAX];
  const ssize_t n = readlink("/proc/self/exe", exe, sizeof exe - 1);
  if (n > 0) {
    std::string dir(exe, static_cast<size_t>(n));
    dir.erase(dir.rfind('/'));
    const std::string beside = dir + "/content-server-catalogue.json";
    if (access(beside.c_str(), R_OK) == 0) return beside;
  }
  return SITEDECK_CONTENT_SERVER_CATALOGUE;
}

}  // namespace

int main(int argc, char** argv) {
  auto server = std::make_shared<cs_server>();
  standin_listen_options options;
  if (!standin_parse_args(argc, argv, &options,
                          [&server](const std::string& k, const std::string& v) {
                            return cs_server_set(server.get(), k, v);
                          })) {
    std::fprintf(stderr,
                 "usage: %s [--port N] [--port-file F] [--quiet] [--catalogue FILE | --items N]\n"
                 "          [--key K] [--path P] [--max-age N] [--<setting> VALUE]...\n",
                 kTool);
    return 2;
  }
  if (server->catalogue_file.empty()) server->catalogue_file = default_catalogue();
  if (!cs_server_prepare(server.get())) return 1;

  httplib::Server svr;
  svr.new_task_queue = [] { return new httplib::ThreadPool(24); };
  cs_server_add_routes(svr, server);
  const int port = standin_bind(svr, options, kTool);
  if (port < 0) return 1;
  {
    std::lock_guard<std::mutex> lock(server->mutex);
    server->port = port;
  }
  return standin_serve(svr, port, options, kTool);
}
