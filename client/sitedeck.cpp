// The `sitedeck` command line: talks to the service the way the browser does,
// one subcommand per request or screenful, so the service can be tried and
// scripted without a browser. Each subcommand is one row of kCommands; exit
// status 0 on success, 1 when the service or the connection failed (the
// status is printed by number, name and meaning) or the output could not be
// written, 2 for bad usage (naming the argument that is wrong).
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "dlog.h"
#include "sitedeck-client.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-tool-output.h"
#include "sitedeck-tool.h"

namespace {

// A service that does not greet or answer within this is given up on.
constexpr int kDefaultTimeoutMs = 10000;

constexpr sds_tool_command kCommands[] = {
    {"hello", "", "connect and print the client id the service issued", sds_tool_hello, sds_tool_no_arguments},
    {"list", "", "table of the live items: id, title, URL, colour, icon size, flags",
     sds_tool_list, sds_tool_no_arguments},
    {"show", "ID", "every field of item ID", sds_tool_show, sds_tool_show_arguments},
    {"icon", "ID -o FILE", "write the icon of item ID to FILE as PNG", sds_tool_icon, sds_tool_icon_arguments},
    {"next-update", "", "seconds until the next data pull is due", sds_tool_next_update, sds_tool_no_arguments},
    {"release", "", "remove the shared-memory object (ends the connection)", sds_tool_release, sds_tool_no_arguments},
    {"init", "--lat LAT --lon LON [--version V]",
     "run a data pull; exit 0 when the deck is current afterwards", sds_tool_init, sds_tool_init_arguments},
    {"status", "", "what is stored under the data directory (no service needed)", sds_tool_status,
     sds_tool_no_arguments, true},
    {"render", "OUT_DIR", "write the deck as a start page to OUT_DIR/index.html", sds_tool_render, sds_tool_render_arguments},
};

struct sds_tool_options {
  std::string socket_path = sds_client_socket_path();
  int timeout_ms = kDefaultTimeoutMs;
  bool verbose = false;
  bool json = false;
  sds_tool_color_mode color = sds_tool_color_mode::automatic;
};

// What the driver does after reading the options before the command.
enum class sds_tool_parse { command, help, version, bad };

void __sds_tool_usage(FILE* out) {
  std::fprintf(out,
               "usage: sitedeck [OPTIONS] COMMAND [ARGUMENTS]\n"
               "Talks to the site deck service the way the browser does.\n\n"
               "options:\n"
               "  --socket PATH   the service's socket (default %s)\n"
               "  --timeout MS    give up on the greeting or a reply after MS milliseconds\n"
               "                  (default %d; 0 waits forever); a pull's result is\n"
               "                  awaited up to 15 minutes\n"
               "  --json          print one JSON document instead of text\n"
               "  --color=WHEN    colours: auto (on a terminal, unless NO_COLOR is set\n"
               "                  or TERM is dumb), always or never\n"
               "  --verbose       show the client library's and the file readers' log lines\n"
               "  -h, --help      show this help\n"
               "  --version       print the version\n\n"
               "commands:\n",
               sds_client_socket_path().c_str(), kDefaultTimeoutMs);
  for (const auto& command : kCommands) {
    std::string synopsis = std::string(command.name) + " " + command.arguments;
    std::fprintf(out, "  %-40s %s\n", synopsis.c_str(), command.help);
  }
  std::fprintf(out,
               "  %-40s %s\n\n"
               "Run 'sitedeck help COMMAND' or 'sitedeck COMMAND --help' for one command.\n"
               "exit status: 0 success, 1 the service, the connection or the output failed,\n"
               "2 bad usage\n",
               "help [COMMAND]", "this help, or the help of COMMAND");
}

// What is wrong with the arguments of a subcommand, and its one-line usage.
void __sds_tool_usage_of(const sds_tool_command& command, const std::string& problem) {
  if (!problem.empty()) std::fprintf(stderr, "sitedeck: %s: %s\n", command.name, problem.c_str());
  std::fprintf(stderr, "usage: sitedeck %s%s%s\nTry 'sitedeck %s --help' for more information.\n",
               command.name, command.arguments[0] != '\0' ? " " : "", command.arguments,
               command.name);
}

void __sds_tool_hint(const char* what) {
  std::fprintf(stderr, "sitedeck: %s\nTry 'sitedeck --help' for more information.\n", what);
}

const sds_tool_command* __sds_tool_find(const char* name) {
  for (const auto& command : kCommands) {
    if (std::strcmp(command.name, name) == 0) return &command;
  }
  return nullptr;
}

// Takes --json and --color from argv[index]; returns how many arguments it
// used (0: not one of them, -1: a --color with a value that is not a mode).
int __sds_tool_output_option(int argc, char** argv, int index, sds_tool_options* options) {
  const char* option = argv[index];
  if (std::strcmp(option, "--json") == 0) {
    options->json = true;
    return 1;
  }
  if (std::strncmp(option, "--color=", 8) == 0) {
    return sds_tool_parse_color_mode(option + 8, &options->color) ? 1 : -1;
  }
  if (std::strcmp(option, "--color") == 0) {
    if (index + 1 >= argc) return -1;
    return sds_tool_parse_color_mode(argv[index + 1], &options->color) ? 2 : -1;
  }
  return 0;
}

// Reads the options before the command and sets `*index` to the command's
// place (argc when there is none).
sds_tool_parse __sds_tool_parse_options(int argc, char** argv, sds_tool_options* options,
                                        int* index) {
  int at = 1;
  while (at < argc && argv[at][0] == '-') {
    const char* option = argv[at];
    const char* value = at + 1 < argc ? argv[at + 1] : nullptr;
    int32_t number = 0;
    int used = __sds_tool_output_option(argc, argv, at, options);
    if (used > 0) {
      at += used;
    } else if (used < 0) {
      __sds_tool_hint("--color takes auto, always or never");
      return sds_tool_parse::bad;
    } else if (std::strcmp(option, "--socket") == 0) {
      if (value == nullptr || value[0] == '\0') {
        __sds_tool_hint("--socket needs a PATH");
        return sds_tool_parse::bad;
      }
      options->socket_path = value;
      at += 2;
    } else if (std::strcmp(option, "--timeout") == 0) {
      if (!sds_tool_parse_id(value, &number)) {
        std::string what = std::string("--timeout needs milliseconds (a whole number), not ") +
                           (value != nullptr ? value : "nothing");
        __sds_tool_hint(what.c_str());
        return sds_tool_parse::bad;
      }
      options->timeout_ms = number;
      at += 2;
    } else if (std::strcmp(option, "--version") == 0) {
      return sds_tool_parse::version;
    } else if (std::strcmp(option, "--verbose") == 0) {
      options->verbose = true;
      at += 1;
    } else if (std::strcmp(option, "--help") == 0 || std::strcmp(option, "-h") == 0) {
      return sds_tool_parse::help;
    } else {
      std::string what = std::string("unknown option ") + option;
      __sds_tool_hint(what.c_str());
      return sds_tool_parse::bad;
    }
  }
  *index = at;
  return sds_tool_parse::command;
}

// `sitedeck help [COMMAND]`.
int __sds_tool_help_command(int argc, char** argv) {
  if (argc == 0) {
    __sds_tool_usage(stdout);
    return 0;
  }
  const sds_tool_command* command = __sds_tool_find(argv[0]);
  if (argc > 1 || command == nullptr) {
    std::string what = std::string("no help for ") + argv[0] + ": not a command";
    __sds_tool_hint(what.c_str());
    return 2;
  }
  sds_tool_print_command_help(stdout, *command);
  return 0;
}

void __sds_tool_report_connect(const std::string& path, int status, int error) {
  if (status == SDS_ERROR_INVALID_PARAMETER) {
    std::fprintf(stderr, "sitedeck: the socket path %s is too long for a socket\n", path.c_str());
    return;
  }
  // A greeting with a status of the service's is the service refusing.
  if (status < SDS_CLIENT_ERROR_NO_SOCKET) {
    std::fprintf(stderr, "sitedeck: the service refused the connection: ");
    sds_tool_print_status(stderr, status);
    std::fprintf(stderr, "\n");
    return;
  }
  std::string reason = sds_client_status_meaning(status);
  // The system's words where the system gave the reason.
  if (error != 0 && status != SDS_CLIENT_ERROR_BUSY) {
    reason += std::string(" (") + std::strerror(error) + ")";
  }
  if (status == SDS_CLIENT_ERROR_NO_SOCKET || status == SDS_CLIENT_ERROR_NOT_LISTENING) {
    reason += "; is the socket unit running?";
  } else if (status == SDS_CLIENT_ERROR_BUSY) {
    reason += "; it serves one connection at a time, try again when that one ends";
  }
  std::fprintf(stderr, "sitedeck: cannot reach the site deck service at %s: %s\n", path.c_str(),
               reason.c_str());
}

void __sds_tool_log_line(void* /*user*/, const char* line) {
  std::fprintf(stderr, "sitedeck: client library: %s\n", line);
}

int __sds_tool_main(int argc, char** argv) {
  // A service that goes away must turn into an error message, not a signal.
  (void)std::signal(SIGPIPE, SIG_IGN);
  sds_tool_options options;
  int index = argc;
  sds_tool_parse parsed = __sds_tool_parse_options(argc, argv, &options, &index);
  if (parsed == sds_tool_parse::help) {
    __sds_tool_usage(stdout);
    return 0;
  }
  if (parsed == sds_tool_parse::version) {
    std::printf("sitedeck %s\n", SITEDECK_VERSION);
    return 0;
  }
  if (parsed == sds_tool_parse::bad) return 2;
  if (index >= argc) {
    __sds_tool_usage(stderr);
    return 2;
  }
  if (std::strcmp(argv[index], "help") == 0) {
    return __sds_tool_help_command(argc - index - 1, argv + index + 1);
  }
  const sds_tool_command* command = __sds_tool_find(argv[index]);
  if (command == nullptr) {
    std::string what = std::string("unknown command ") + argv[index];
    __sds_tool_hint(what.c_str());
    return 2;
  }
  // The output options may follow the command too; the rest is the
  // command's own.
  std::vector<char*> arguments;
  for (int at = index + 1; at < argc;) {
    if (std::strcmp(argv[at], "--help") == 0 || std::strcmp(argv[at], "-h") == 0) {
      sds_tool_print_command_help(stdout, *command);
      return 0;
    }
    int used = __sds_tool_output_option(argc, argv, at, &options);
    if (used < 0) {
      __sds_tool_hint("--color takes auto, always or never");
      return 2;
    }
    if (used == 0) arguments.push_back(argv[at]);
    at += used > 0 ? used : 1;
  }
  arguments.push_back(nullptr);

  sds_tool_settings& output = sds_tool_output();
  output.json = options.json;
  output.color =
      !options.json && sds_tool_decide_color(options.color, isatty(STDOUT_FILENO) == 1,
                                             std::getenv("NO_COLOR"), std::getenv("TERM"));
  output.columns = options.json ? 0 : sds_tool_terminal_columns(STDOUT_FILENO);
  // The file readers log every problem they meet; a person wants one line.
  dlog_set_quiet(!options.verbose);
  if (options.verbose) sds_client_set_log(__sds_tool_log_line, nullptr);

  const int command_argc = static_cast<int>(arguments.size()) - 1;
  std::string problem;
  if (!command->arguments_ok(command_argc, arguments.data(), &problem)) {
    __sds_tool_usage_of(*command, problem);
    return 2;
  }
  SdsConnection connection;
  if (!command->offline) {
    sds_client_timeouts timeouts;
    timeouts.connect_ms = options.timeout_ms;
    timeouts.reply_ms = options.timeout_ms;
    int status = sds_client_connect(options.socket_path, connection, timeouts);
    if (status != SDS_ERROR_NONE) {
      __sds_tool_report_connect(options.socket_path, status, connection.error_number());
      return 1;
    }
  }
  int status = command->run(connection, command_argc, arguments.data());
  if (status == kSdsToolUsage) {
    __sds_tool_usage_of(*command, "");
    return 2;
  }
  if (status == kSdsToolReported) return 1;
  if (status != SDS_ERROR_NONE) {
    sds_tool_report_status(status);
    return 1;
  }
  return 0;
}

// What coreutils do at exit: output that could not be written (a full disk,
// a reader that went away) is a failure of the command, told on stderr.
int __sds_tool_finish_output(int code) {
  errno = 0;
  bool failed = std::fflush(stdout) != 0;
  failed = std::ferror(stdout) != 0 || failed;
  int error = errno;
  if (std::fclose(stdout) != 0 && !failed) {
    failed = true;
    error = errno;
  }
  if (!failed) return code;
  if (error != 0) {
    std::fprintf(stderr, "sitedeck: write error: %s\n", std::strerror(error));
  } else {
    std::fprintf(stderr, "sitedeck: write error\n");
  }
  return 1;
}

}  // namespace

int main(int argc, char** argv) { return __sds_tool_finish_output(__sds_tool_main(argc, argv)); }
