// The `sitedeck` command line: talks to the service the way the browser does,
// one subcommand per request or screenful, so the service can be tried and
// scripted without a browser. Each subcommand is one row of kCommands; exit
// status 0 on success, 1 when the service or the connection failed (the
// status is printed by name and number), 2 for bad usage.
#include <csignal>
#include <cstdio>
#include <cstring>
#include <string>

#include "dlog.h"
#include "sitedeck-client.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-tool.h"

namespace {

// A service that does not answer a read within this is given up on.
constexpr int kDefaultTimeoutMs = 10000;
// The library's reads are tried three times before they give up.
constexpr int kReadAttempts = 3;

constexpr sds_tool_command kCommands[] = {
    {"hello", "", "connect and print the client id the service issued", sds_tool_hello},
    {"list", "", "table of the live items: id, title, URL, colour, icon size, flags",
     sds_tool_list},
    {"show", "ID", "every field of item ID", sds_tool_show},
    {"icon", "ID -o FILE", "write the icon of item ID to FILE as PNG", sds_tool_icon},
    {"next-update", "", "seconds until the next data pull is due", sds_tool_next_update},
    {"release", "", "remove the shared-memory object (ends the connection)", sds_tool_release},
    {"init", "--lat LAT --lon LON [--version V]",
     "run a data pull; exit 0 when the deck is current afterwards", sds_tool_init},
    {"render", "OUT_DIR", "write the deck as a start page to OUT_DIR/index.html", sds_tool_render},
};

struct sds_tool_options {
  std::string socket_path = sds_path(SDS_SOCKET_PATH);
  int timeout_ms = kDefaultTimeoutMs;
  bool verbose = false;
};

void __sds_tool_usage(FILE* out) {
  std::fprintf(out,
               "usage: sitedeck [OPTIONS] COMMAND [ARGUMENTS]\n"
               "options:\n"
               "  --socket PATH  the service's socket (default %s)\n"
               "  --timeout MS   give up on a reply after MS milliseconds (default %d;\n"
               "                 0 waits forever; a pull's result is always awaited)\n"
               "  --verbose      show the protocol library's log lines\n"
               "commands:\n",
               sds_path(SDS_SOCKET_PATH).c_str(), kDefaultTimeoutMs);
  for (const auto& command : kCommands) {
    std::string synopsis = std::string(command.name) + " " + command.arguments;
    std::fprintf(out, "  %-46s %s\n", synopsis.c_str(), command.help);
  }
}

const sds_tool_command* __sds_tool_find(const char* name) {
  for (const auto& command : kCommands) {
    if (std::strcmp(command.name, name) == 0) return &command;
  }
  return nullptr;
}

// Reads the options before the command; returns the index of the command
// name, argc when there is none, or -1 after an unusable option (-2: --help).
int __sds_tool_parse_options(int argc, char** argv, sds_tool_options* options) {
  int index = 1;
  while (index < argc && argv[index][0] == '-') {
    const char* option = argv[index];
    const char* value = index + 1 < argc ? argv[index + 1] : nullptr;
    int32_t number = 0;
    if (std::strcmp(option, "--socket") == 0 && value != nullptr) {
      options->socket_path = value;
      index += 2;
    } else if (std::strcmp(option, "--timeout") == 0 && sds_tool_parse_id(value, &number)) {
      options->timeout_ms = number;
      index += 2;
    } else if (std::strcmp(option, "--verbose") == 0) {
      options->verbose = true;
      index += 1;
    } else if (std::strcmp(option, "--help") == 0 || std::strcmp(option, "-h") == 0) {
      return -2;
    } else {
      std::fprintf(stderr, "sitedeck: unknown or incomplete option %s\n", option);
      return -1;
    }
  }
  return index;
}

}  // namespace

int main(int argc, char** argv) {
  // A service that goes away must turn into an error message, not a signal.
  (void)std::signal(SIGPIPE, SIG_IGN);
  sds_tool_options options;
  int index = __sds_tool_parse_options(argc, argv, &options);
  if (index == -2) {
    __sds_tool_usage(stdout);
    return 0;
  }
  if (index < 0 || index >= argc) {
    __sds_tool_usage(stderr);
    return 2;
  }
  const sds_tool_command* command = __sds_tool_find(argv[index]);
  if (command == nullptr) {
    std::fprintf(stderr, "sitedeck: unknown command %s\n", argv[index]);
    __sds_tool_usage(stderr);
    return 2;
  }
  // The library logs every failed read and write; a person wants one line.
  dlog_set_quiet(!options.verbose);

  SdsConnection connection;
  int read_timeout_ms = (options.timeout_ms + kReadAttempts - 1) / kReadAttempts;
  int status = sds_client_connect(options.socket_path, &connection, read_timeout_ms);
  if (status != SDS_ERROR_NONE) {
    std::fprintf(stderr, "sitedeck: %s: cannot connect to %s: ", command->name,
                 options.socket_path.c_str());
    sds_tool_print_status(stderr, status);
    std::fprintf(stderr, "\n");
    return 1;
  }
  status = command->run(connection, argc - index - 1, argv + index + 1);
  if (status == kSdsToolUsage) {
    std::fprintf(stderr, "usage: sitedeck %s %s\n", command->name, command->arguments);
    return 2;
  }
  if (status == kSdsToolReported) return 1;
  if (status != SDS_ERROR_NONE) {
    std::fprintf(stderr, "sitedeck: %s: ", command->name);
    sds_tool_print_status(stderr, status);
    std::fprintf(stderr, "\n");
    return 1;
  }
  return 0;
}
