// How the `sitedeck` tool prints: the global output settings (JSON or text,
// colours, terminal width), aligned tables and "key: value" blocks measured
// in terminal columns (titles are UTF-8 and may hold wide characters), and
// the JSON document every data-printing subcommand produces with --json.
// Nothing here talks to the service.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <utility>
#include <vector>

typedef struct _JsonBuilder JsonBuilder;

enum class sds_tool_color_mode { automatic, always, never };

// Decided once by the driver before a subcommand runs.
struct sds_tool_settings {
  bool json = false;
  bool color = false;
  // Columns of the terminal stdout is, or 0 when it is not a terminal (then
  // nothing is cut to fit).
  size_t columns = 0;
};
sds_tool_settings& sds_tool_output();

// Colours are for a person at a terminal: "auto" wants stdout to be one,
// NO_COLOR unset or empty and TERM not "dumb". `no_color`/`term` may be null.
bool sds_tool_decide_color(sds_tool_color_mode mode, bool stdout_is_terminal, const char* no_color,
                           const char* term);
// Parses "auto", "always" or "never"; false for anything else.
bool sds_tool_parse_color_mode(const char* text, sds_tool_color_mode* mode);
// Columns of the terminal behind `fd`, or 0 when it is none.
size_t sds_tool_terminal_columns(int fd);

// Terminal columns `text` takes, read as UTF-8 whatever the locale: wide
// characters count two, combining marks none, an invalid byte one.
size_t sds_tool_display_width(const std::string& text);
// `text` cut to at most `columns` columns, a cut marked by "…".
std::string sds_tool_fit(const std::string& text, size_t columns);
// True for "#RRGGBB"; sets the three channels.
bool sds_tool_parse_hex_color(const char* text, int* red, int* green, int* blue);

// One cell: the text, and for a colour column the colour text whose swatch
// goes in front of it when colours are on.
struct sds_tool_cell {
  std::string text;
  bool swatch = false;
};
struct sds_tool_table {
  std::vector<std::string> header;
  // Columns that give way, widest first, when the table is wider than the
  // terminal.
  std::vector<bool> shrinkable;
  std::vector<std::vector<sds_tool_cell>> rows;
};
// The table as lines, columns two blanks apart, the last column unpadded.
// Control characters and bytes that are no UTF-8 in cells and values print
// as "?", here and in sds_tool_format_fields.
std::string sds_tool_format_table(const sds_tool_table& table, const sds_tool_settings& settings);

// Aligned "key: value" lines; a value may carry a swatch as a cell does.
// Values start after the widest key or at `min_key_columns`, whichever is
// further, so that blocks printed apart still line up.
std::string sds_tool_format_fields(const std::vector<std::pair<std::string, sds_tool_cell>>& fields,
                                   const sds_tool_settings& settings, size_t min_key_columns = 0);

// SGR `code` around `text` when colours are on ("1" bold, "2" dim...).
std::string sds_tool_style(const std::string& text, const char* code,
                           const sds_tool_settings& settings);

struct SdsJsonBuilderFree {
  void operator()(JsonBuilder* builder) const noexcept;
};
using UniqueJsonBuilder = std::unique_ptr<JsonBuilder, SdsJsonBuilderFree>;
UniqueJsonBuilder sds_tool_json_builder();
// Adds member `name` with `value` (null: JSON null; invalid UTF-8 is mended).
void sds_tool_json_text(JsonBuilder* builder, const char* name, const char* value);
void sds_tool_json_int(JsonBuilder* builder, const char* name, long long value);
void sds_tool_json_bool(JsonBuilder* builder, const char* name, bool value);
void sds_tool_json_null(JsonBuilder* builder, const char* name);
// The finished document as text, indented, with a final newline.
std::string sds_tool_json_text_of(JsonBuilder* builder);
// Prints the finished document on stdout; false when that failed.
bool sds_tool_json_print(JsonBuilder* builder);
