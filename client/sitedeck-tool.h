// Pieces of the `sitedeck` command line shared between its files: the shape of
// a subcommand and the helpers for parsing arguments and reporting statuses.
#pragma once

#include <cstdint>
#include <cstdio>
#include <string>

#include "sitedeck-client.h"

// Results of a subcommand besides SDS codes (which are all 0 or above).
constexpr int kSdsToolUsage = -1;     // bad arguments: print the usage, exit 2
constexpr int kSdsToolReported = -2;  // failure already told to the user: exit 1

// A subcommand gets the open connection and its own arguments (argv[0] is the
// first argument after its name). It returns SDS_ERROR_NONE, another SDS code
// for the driver to report, or one of the kSdsTool* results.
struct sds_tool_command {
  const char* name;
  const char* arguments;
  const char* help;
  int (*run)(SdsConnection& connection, int argc, char** argv);
  // Whether the arguments are well formed; checked before connecting, so bad
  // usage is told (exit 2) whether or not the service is reachable. When
  // they are not, `problem` names the argument that is wrong.
  bool (*arguments_ok)(int argc, char** argv, std::string* problem);
  // Works from the files alone: the driver does not connect, and `run` gets
  // a connection that is not open.
  bool offline = false;
};

int sds_tool_hello(SdsConnection& connection, int argc, char** argv);
int sds_tool_list(SdsConnection& connection, int argc, char** argv);
int sds_tool_show(SdsConnection& connection, int argc, char** argv);
int sds_tool_icon(SdsConnection& connection, int argc, char** argv);
int sds_tool_next_update(SdsConnection& connection, int argc, char** argv);
int sds_tool_release(SdsConnection& connection, int argc, char** argv);
int sds_tool_init(SdsConnection& connection, int argc, char** argv);
int sds_tool_render(SdsConnection& connection, int argc, char** argv);
int sds_tool_status(SdsConnection& connection, int argc, char** argv);

// Argument checks of the subcommands, one per shape of arguments.
bool sds_tool_no_arguments(int argc, char** argv, std::string* problem);
bool sds_tool_show_arguments(int argc, char** argv, std::string* problem);
bool sds_tool_icon_arguments(int argc, char** argv, std::string* problem);
bool sds_tool_init_arguments(int argc, char** argv, std::string* problem);
bool sds_tool_render_arguments(int argc, char** argv, std::string* problem);

// Parses a whole decimal item id (0 to INT32_MAX); false for anything else.
bool sds_tool_parse_id(const char* text, int32_t* id);
// Parses a whole decimal number (a coordinate); false for anything else.
bool sds_tool_parse_double(const char* text, double* value);
// "N NAME: meaning" for an SDS code, NAME being the constant's own name.
void sds_tool_print_status(FILE* out, int status);
// Tells the user on stderr what a non-zero status from the service (or a
// lost connection, status 1) means, as one "sitedeck: ..." line.
void sds_tool_report_status(int status);

// The help of one subcommand: synopsis, what it does, its options, an
// example and its exit statuses.
void sds_tool_print_command_help(FILE* out, const sds_tool_command& command);
