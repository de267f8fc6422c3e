// Text and JSON output of the `sitedeck` tool. Widths are measured in
// terminal columns of the UTF-8 text (the service's titles are UTF-8 whatever
// the user's locale), so the decoding is done here and only the width of each
// character is asked of the C library, under a UTF-8 locale of its own.
#include "sitedeck-tool-output.h"

#include <json-glib/json-glib.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <clocale>
#include <cstdio>
#include <cstring>
#include <cwchar>

namespace {

constexpr char kEllipsis[] = "\xE2\x80\xA6";  // U+2026, one column
// A column that gives way is not made narrower than this.
constexpr size_t kMinShrunkColumn = 6;
// Columns the swatch takes in front of a colour: two coloured blanks, a blank.
constexpr size_t kSwatchColumns = 3;

struct sds_tool_glyph {
  size_t bytes;
  size_t columns;
  bool unsafe = false;  // a control character or a byte that is no UTF-8
};

// The next character of `text` at `at`: its length in bytes (an invalid
// sequence is one byte) and its terminal columns.
sds_tool_glyph __next_glyph(const std::string& text, size_t at) {
  const auto lead = static_cast<unsigned char>(text[at]);
  size_t length = lead < 0x80           ? 1
                  : (lead >> 5) == 0x6  ? 2
                  : (lead >> 4) == 0xE  ? 3
                  : (lead >> 3) == 0x1E ? 4
                                        : 0;
  if (length == 0 || at + length > text.size()) return {1, 1, true};
  char32_t code = length == 1 ? lead : lead & (0x7F >> length);
  for (size_t i = 1; i < length; ++i) {
    const auto next = static_cast<unsigned char>(text[at + i]);
    if ((next & 0xC0) != 0x80) return {1, 1, true};
    code = (code << 6) | (next & 0x3F);
  }
  if (code < 0x20 || (code >= 0x7F && code <= 0x9F)) return {length, 0, true};
  if (code < 0x7F) return {length, 1};
  // wcwidth knows the wide and zero-width characters only under a UTF-8
  // locale; the process's own may be "C".
  static locale_t utf8 = newlocale(LC_CTYPE_MASK, "C.UTF-8", static_cast<locale_t>(nullptr));
  if (utf8 == static_cast<locale_t>(nullptr)) return {length, 1};
  locale_t previous = uselocale(utf8);
  int columns = wcwidth(static_cast<wchar_t>(code));
  (void)uselocale(previous);
  return {length, columns < 0 ? size_t{1} : static_cast<size_t>(columns)};
}

// Texts from the network and from files reach the terminal: a control
// character in a title could move the cursor or retitle the window, so each
// one (and each byte that is no UTF-8) is shown as "?".
std::string __printable(const std::string& text) {
  std::string out;
  for (size_t at = 0; at < text.size();) {
    sds_tool_glyph glyph = __next_glyph(text, at);
    if (glyph.unsafe) {
      out += '?';
    } else {
      out.append(text, at, glyph.bytes);
    }
    at += glyph.bytes;
  }
  return out;
}

int __hex_digit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// The swatch for `text` when colours are on and it is a colour, else "".
std::string __swatch(const sds_tool_cell& cell, const sds_tool_settings& settings) {
  int red = 0, green = 0, blue = 0;
  if (!cell.swatch || !settings.color ||
      !sds_tool_parse_hex_color(cell.text.c_str(), &red, &green, &blue)) {
    return "";
  }
  char sgr[48];
  std::snprintf(sgr, sizeof sgr, "\033[48;2;%d;%d;%dm  \033[0m ", red, green, blue);
  return sgr;
}

size_t __cell_width(const sds_tool_cell& cell, const sds_tool_settings& settings) {
  return sds_tool_display_width(cell.text) +
         (__swatch(cell, settings).empty() ? 0 : kSwatchColumns);
}

// The cell fitted into `width` columns and padded to it unless it is `last`.
std::string __render_cell(const sds_tool_cell& cell, size_t width, bool last,
                          const sds_tool_settings& settings, const char* style) {
  std::string swatch = __swatch(cell, settings);
  size_t room = width;
  if (!swatch.empty()) room = width > kSwatchColumns ? width - kSwatchColumns : 0;
  std::string text = sds_tool_fit(cell.text, room);
  size_t used = sds_tool_display_width(text) + (swatch.empty() ? 0 : kSwatchColumns);
  std::string out = swatch + (style != nullptr ? sds_tool_style(text, style, settings) : text);
  if (!last && used < width) out.append(width - used, ' ');
  return out;
}

void __add_name(JsonBuilder* builder, const char* name) {
  if (name != nullptr) json_builder_set_member_name(builder, name);
}

}  // namespace

sds_tool_settings& sds_tool_output() {
  static sds_tool_settings settings;
  return settings;
}

bool sds_tool_decide_color(sds_tool_color_mode mode, bool stdout_is_terminal, const char* no_color,
                           const char* term) {
  if (mode != sds_tool_color_mode::automatic) return mode == sds_tool_color_mode::always;
  if (!stdout_is_terminal) return false;
  if (no_color != nullptr && no_color[0] != '\0') return false;
  return term == nullptr || std::strcmp(term, "dumb") != 0;
}

bool sds_tool_parse_color_mode(const char* text, sds_tool_color_mode* mode) {
  if (text == nullptr) return false;
  if (std::strcmp(text, "auto") == 0) {
    *mode = sds_tool_color_mode::automatic;
  } else if (std::strcmp(text, "always") == 0) {
    *mode = sds_tool_color_mode::always;
  } else if (std::strcmp(text, "never") == 0) {
    *mode = sds_tool_color_mode::never;
  } else {
    return false;
  }
  return true;
}

size_t sds_tool_terminal_columns(int fd) {
  if (isatty(fd) != 1) return 0;
  struct winsize size {};
  // A terminal that does not tell its size gets the classic 80 columns.
  if (ioctl(fd, TIOCGWINSZ, &size) != 0 || size.ws_col == 0) return 80;
  return size.ws_col;
}

size_t sds_tool_display_width(const std::string& text) {
  size_t columns = 0;
  for (size_t at = 0; at < text.size();) {
    sds_tool_glyph glyph = __next_glyph(text, at);
    columns += glyph.columns;
    at += glyph.bytes;
  }
  return columns;
}

std::string sds_tool_fit(const std::string& text, size_t columns) {
  if (sds_tool_display_width(text) <= columns) return text;
  if (columns == 0) return "";
  size_t used = 0, at = 0;
  while (at < text.size()) {
    sds_tool_glyph glyph = __next_glyph(text, at);
    if (used + glyph.columns > columns - 1) break;
    used += glyph.columns;
    at += glyph.bytes;
  }
  return text.substr(0, at) + kEllipsis;
}

bool sds_tool_parse_hex_color(const char* text, int* red, int* green, int* blue) {
  if (text == nullptr || std::strlen(text) != 7 || text[0] != '#') return false;
  int channels[3];
  for (int i = 0; i < 3; ++i) {
    int high = __hex_digit(text[1 + 2 * i]), low = __hex_digit(text[2 + 2 * i]);
    if (high < 0 || low < 0) return false;
    channels[i] = high * 16 + low;
  }
  *red = channels[0];
  *green = channels[1];
  *blue = channels[2];
  return true;
}

std::string sds_tool_style(const std::string& text, const char* code,
                           const sds_tool_settings& settings) {
  if (!settings.color || text.empty()) return text;
  return std::string("\033[") + code + "m" + text + "\033[0m";
}

std::string sds_tool_format_table(const sds_tool_table& given, const sds_tool_settings& settings) {
  sds_tool_table table = given;
  for (auto& row : table.rows) {
    for (auto& cell : row) cell.text = __printable(cell.text);
  }
  const size_t count = table.header.size();
  std::vector<size_t> widths(count, 0);
  for (size_t i = 0; i < count; ++i) widths[i] = sds_tool_display_width(table.header[i]);
  for (const auto& row : table.rows) {
    for (size_t i = 0; i < count && i < row.size(); ++i) {
      widths[i] = std::max(widths[i], __cell_width(row[i], settings));
    }
  }
  if (settings.columns > 0) {
    size_t total = 2 * (count - 1);
    for (size_t width : widths) total += width;
    while (total > settings.columns) {
      size_t widest = count;
      for (size_t i = 0; i < count; ++i) {
        bool gives_way = i < table.shrinkable.size() && table.shrinkable[i];
        if (gives_way && widths[i] > kMinShrunkColumn &&
            (widest == count || widths[i] > widths[widest])) {
          widest = i;
        }
      }
      if (widest == count) break;
      --widths[widest];
      --total;
    }
  }
  std::string out;
  for (size_t i = 0; i < count; ++i) {
    out += __render_cell({table.header[i], false}, widths[i], i + 1 == count, settings, "1");
    out += i + 1 == count ? "\n" : "  ";
  }
  for (const auto& row : table.rows) {
    for (size_t i = 0; i < count; ++i) {
      sds_tool_cell cell = i < row.size() ? row[i] : sds_tool_cell{};
      out += __render_cell(cell, widths[i], i + 1 == count, settings, nullptr);
      out += i + 1 == count ? "\n" : "  ";
    }
  }
  return out;
}

std::string sds_tool_format_fields(const std::vector<std::pair<std::string, sds_tool_cell>>& fields,
                                   const sds_tool_settings& settings, size_t min_key_columns) {
  size_t key_width = min_key_columns;
  for (const auto& field : fields) {
    key_width = std::max(key_width, sds_tool_display_width(field.first) + 1);
  }
  std::string out;
  for (const auto& field : fields) {
    std::string key = field.first + ":";
    out += sds_tool_style(key, "1", settings);
    out.append(key_width - sds_tool_display_width(key) + 1, ' ');
    out += __swatch(field.second, settings) + __printable(field.second.text) + "\n";
  }
  return out;
}

void SdsJsonBuilderFree::operator()(JsonBuilder* builder) const noexcept {
  g_object_unref(builder);
}

UniqueJsonBuilder sds_tool_json_builder() { return UniqueJsonBuilder(json_builder_new()); }

void sds_tool_json_text(JsonBuilder* builder, const char* name, const char* value) {
  __add_name(builder, name);
  if (value == nullptr) {
    json_builder_add_null_value(builder);
  } else if (g_utf8_validate(value, -1, nullptr)) {
    json_builder_add_string_value(builder, value);
  } else {
    gchar* mended = g_utf8_make_valid(value, -1);
    json_builder_add_string_value(builder, mended);
    g_free(mended);
  }
}

void sds_tool_json_int(JsonBuilder* builder, const char* name, long long value) {
  __add_name(builder, name);
  json_builder_add_int_value(builder, value);
}

void sds_tool_json_bool(JsonBuilder* builder, const char* name, bool value) {
  __add_name(builder, name);
  json_builder_add_boolean_value(builder, value ? TRUE : FALSE);
}

void sds_tool_json_null(JsonBuilder* builder, const char* name) {
  __add_name(builder, name);
  json_builder_add_null_value(builder);
}

std::string sds_tool_json_text_of(JsonBuilder* builder) {
  JsonNode* root = json_builder_get_root(builder);
  if (root == nullptr) return "";
  JsonGenerator* generator = json_generator_new();
  json_generator_set_root(generator, root);
  json_generator_set_pretty(generator, TRUE);
  json_generator_set_indent(generator, 2);
  gchar* data = json_generator_to_data(generator, nullptr);
  std::string text = data != nullptr ? std::string(data) + "\n" : "";
  g_free(data);
  g_object_unref(generator);
  json_node_unref(root);
  return text;
}

bool sds_tool_json_print(JsonBuilder* builder) {
  std::string text = sds_tool_json_text_of(builder);
  if (text.empty()) return false;
  return std::fwrite(text.data(), 1, text.size(), stdout) == text.size();
}
