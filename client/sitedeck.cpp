// The `sitedeck` command line: talks to the service the way the browser does,
// one subcommand per request, so the service can be tried and scripted
// without a browser. Each subcommand is one row of kCommands.
#include <csignal>
#include <cstdio>
#include <cstring>
#include <string>

#include "sitedeck-client.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"

namespace {

// A subcommand gets the open connection and its own arguments; it returns an
// SDS code, which the driver reports when it is not SDS_ERROR_NONE.
struct sds_tool_command {
  const char* name;
  const char* arguments;
  const char* help;
  int expected_arguments;
  int (*run)(const SdsConnection& connection, char** arguments);
};

int __sds_tool_hello(const SdsConnection& connection, char** /*arguments*/) {
  std::printf("client id: %d\n", connection.cid());
  return SDS_ERROR_NONE;
}

constexpr sds_tool_command kCommands[] = {
    {"hello", "", "connect and print the client id the service issued", 0, __sds_tool_hello},
};

void __sds_tool_usage(FILE* out) {
  std::fprintf(out,
               "usage: sitedeck [--socket PATH] COMMAND [ARGUMENTS]\n"
               "  --socket PATH  the service's socket (default %s)\n"
               "commands:\n",
               sds_path(SDS_SOCKET_PATH).c_str());
  for (const auto& command : kCommands) {
    std::string synopsis = std::string(command.name) + " " + command.arguments;
    std::fprintf(out, "  %-14s %s\n", synopsis.c_str(), command.help);
  }
}

const sds_tool_command* __sds_tool_find(const char* name) {
  for (const auto& command : kCommands) {
    if (std::strcmp(command.name, name) == 0) return &command;
  }
  return nullptr;
}

}  // namespace

int main(int argc, char** argv) {
  // A service that goes away must turn into an error message, not a signal.
  (void)std::signal(SIGPIPE, SIG_IGN);
  std::string socket_path = sds_path(SDS_SOCKET_PATH);
  int index = 1;
  while (index < argc && argv[index][0] == '-') {
    if (std::strcmp(argv[index], "--socket") == 0 && index + 1 < argc) {
      socket_path = argv[index + 1];
      index += 2;
    } else if (std::strcmp(argv[index], "--help") == 0 || std::strcmp(argv[index], "-h") == 0) {
      __sds_tool_usage(stdout);
      return 0;
    } else {
      std::fprintf(stderr, "sitedeck: unknown option %s\n", argv[index]);
      __sds_tool_usage(stderr);
      return 2;
    }
  }
  if (index >= argc) {
    __sds_tool_usage(stderr);
    return 2;
  }
  const sds_tool_command* command = __sds_tool_find(argv[index]);
  if (command == nullptr) {
    std::fprintf(stderr, "sitedeck: unknown command %s\n", argv[index]);
    __sds_tool_usage(stderr);
    return 2;
  }
  if (argc - index - 1 != command->expected_arguments) {
    std::fprintf(stderr, "usage: sitedeck %s %s\n", command->name, command->arguments);
    return 2;
  }

  SdsConnection connection;
  int status = sds_client_connect(socket_path, &connection);
  if (status != SDS_ERROR_NONE) {
    std::fprintf(stderr, "sitedeck: %s: cannot connect to %s: %s (%d)\n", command->name,
                 socket_path.c_str(), sds_error_string(status), status);
    return 1;
  }
  status = command->run(connection, argv + index + 1);
  if (status != SDS_ERROR_NONE) {
    std::fprintf(stderr, "sitedeck: %s: %s (%d)\n", command->name, sds_error_string(status),
                 status);
    return 1;
  }
  return 0;
}
