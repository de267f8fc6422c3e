// The `sitedeck` tool's printing helpers on their own: widths of UTF-8 text
// in terminal columns, cutting to fit, colour decisions and colour texts,
// tables as a terminal and as a pipe see them, ages in words, and the
// names and meanings of every status the client library explains.
#include <gtest/gtest.h>

#include <string>

#include "sitedeck-client-status.h"
#include "sitedeck-tool-output.h"
#include "sitedeck-tool-status.h"

namespace {

TEST(ToolOutput, DisplayWidthCountsTerminalColumns) {
  struct Case {
    const char* name;
    std::string text;
    size_t columns;
  } cases[] = {
      {"ascii", "News", 4},
      {"empty", "", 0},
      {"accented", "Caf\xC3\xA9", 4},
      {"combining mark", "e\xCC\x81", 1},
      {"wide CJK", "\xE6\x97\xA5\xE6\x9C\xAC", 4},
      {"invalid byte", "a\377b", 3},
      {"cut sequence", "a\xE6\x97", 3},
  };
  for (const auto& c : cases) EXPECT_EQ(sds_tool_display_width(c.text), c.columns) << c.name;
}

TEST(ToolOutput, FitCutsWithAnEllipsisOnCharacterBoundaries) {
  struct Case {
    const char* name;
    std::string text;
    size_t columns;
    std::string fitted;
  } cases[] = {
      {"fits", "News", 4, "News"},
      {"one too long", "Hello", 4, "Hel\xE2\x80\xA6"},
      {"no room", "Hello", 0, ""},
      {"only the ellipsis", "Hello", 1, "\xE2\x80\xA6"},
      // Three wide characters in 5 columns: two of them and the ellipsis.
      {"wide", "\xE6\x97\xA5\xE6\x9C\xAC\xE8\xAA\x9E", 5, "\xE6\x97\xA5\xE6\x9C\xAC\xE2\x80\xA6"},
      // A wide character that would end past the room is left out whole.
      {"wide at the edge", "\xE6\x97\xA5\xE6\x9C\xAC\xE8\xAA\x9E", 4, "\xE6\x97\xA5\xE2\x80\xA6"},
  };
  for (const auto& c : cases) EXPECT_EQ(sds_tool_fit(c.text, c.columns), c.fitted) << c.name;
}

TEST(ToolOutput, OnlyWellFormedColourTextsGiveChannels) {
  int red = -1, green = -1, blue = -1;
  ASSERT_TRUE(sds_tool_parse_hex_color("#AA10fe", &red, &green, &blue));
  EXPECT_EQ(red, 0xAA);
  EXPECT_EQ(green, 0x10);
  EXPECT_EQ(blue, 0xFE);
  for (const char* bad : {"", "#AA00", "AA00000", "#GG0000", "#AA0000;", "red"}) {
    EXPECT_FALSE(sds_tool_parse_hex_color(bad, &red, &green, &blue)) << bad;
  }
  EXPECT_FALSE(sds_tool_parse_hex_color(nullptr, &red, &green, &blue));
}

TEST(ToolOutput, ColoursOnlyForAPersonAtATerminal) {
  using Mode = sds_tool_color_mode;
  struct Case {
    const char* name;
    Mode mode;
    bool terminal;
    const char* no_color;
    const char* term;
    bool color;
  } cases[] = {
      {"terminal", Mode::automatic, true, nullptr, "xterm-256color", true},
      {"no TERM", Mode::automatic, true, nullptr, nullptr, true},
      {"pipe", Mode::automatic, false, nullptr, "xterm", false},
      {"NO_COLOR", Mode::automatic, true, "1", "xterm", false},
      {"empty NO_COLOR", Mode::automatic, true, "", "xterm", true},
      {"dumb", Mode::automatic, true, nullptr, "dumb", false},
      {"always on a pipe", Mode::always, false, "1", "dumb", true},
      {"never on a terminal", Mode::never, true, nullptr, "xterm", false},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(sds_tool_decide_color(c.mode, c.terminal, c.no_color, c.term), c.color) << c.name;
  }
  Mode mode = Mode::automatic;
  EXPECT_TRUE(sds_tool_parse_color_mode("never", &mode));
  EXPECT_EQ(mode, Mode::never);
  EXPECT_FALSE(sds_tool_parse_color_mode("sometimes", &mode));
  EXPECT_EQ(mode, Mode::never);
}

sds_tool_table ItemTable() {
  sds_tool_table table;
  table.header = {"ID", "TITLE", "COLOUR"};
  table.shrinkable = {false, true, false};
  table.rows = {{{"7"}, {"\xE6\x97\xA5\xE6\x9C\xAC News today"}, {"#AA0000", true}},
                {{"12"}, {"Mail"}, {"-", true}}};
  return table;
}

// A pipe keeps whole cells and no escapes; a narrow terminal cuts the
// columns that give way; colours give a bold header and swatches for valid
// colours only.
TEST(ToolOutput, TablesAsAPipeANarrowTerminalAndWithColoursSeeThem) {
  struct Case {
    const char* name;
    size_t columns;
    bool color;
    std::string table;
  } cases[] = {
      {"pipe", 0, false,
       "ID  TITLE            COLOUR\n"
       "7   \xE6\x97\xA5\xE6\x9C\xAC News today  #AA0000\n"
       "12  Mail             -\n"},
      {"narrow terminal", 22, false,
       "ID  TITLE      COLOUR\n"
       "7   \xE6\x97\xA5\xE6\x9C\xAC New\xE2\x80\xA6  #AA0000\n"
       "12  Mail       -\n"},
      {"colours", 0, true,
       "\033[1mID\033[0m  \033[1mTITLE\033[0m            \033[1mCOLOUR\033[0m\n"
       "7   \xE6\x97\xA5\xE6\x9C\xAC News today  \033[48;2;170;0;0m  \033[0m #AA0000\n"
       "12  Mail             -\n"},
  };
  for (const auto& c : cases) {
    sds_tool_settings settings;
    settings.columns = c.columns;
    settings.color = c.color;
    EXPECT_EQ(sds_tool_format_table(ItemTable(), settings), c.table) << c.name;
  }
}

TEST(ToolOutput, ControlCharactersFromTheNetworkCannotReachTheTerminal) {
  sds_tool_table table;
  table.header = {"ID", "TITLE"};
  table.rows = {{{"1"},
                 {"Evil\033]2;owned\007 \xC2\x9B"
                  "31m\xFFTitle"}}};
  EXPECT_EQ(sds_tool_format_table(table, sds_tool_settings{}),
            "ID  TITLE\n"
            "1   Evil?]2;owned? ?31m?Title\n");
  // Fields also align their values.
  EXPECT_EQ(
      sds_tool_format_fields({{"city", {"Jongno\r\n-gu"}}, {"dominant colour", {"#0F0", true}}},
                             sds_tool_settings{}),
      "city:            Jongno?"
      "?-gu\n"
      "dominant colour: #0F0\n");
}

TEST(ToolOutput, AgesInWords) {
  struct Case {
    long long seconds;
    const char* text;
  } cases[] = {
      {-5, "in the future"},      {0, "0 s ago"},         {59, "59 s ago"},
      {60, "1 min ago"},          {3599, "59 min ago"},   {11520, "3 h 12 min ago"},
      {86399, "23 h 59 min ago"}, {86400, "1 d 0 h ago"}, {200000, "2 d 7 h ago"},
  };
  for (const auto& c : cases) EXPECT_EQ(sds_tool_format_age(c.seconds), c.text) << c.seconds;
}

// Names and meanings of 1..21 are checked through the tool in
// SitedeckToolMessages.EveryNonZeroStatusIsToldByNumberNameAndMeaning.
TEST(ToolOutput, StatusZeroAndNumbersOutsideTheRangeHaveNames) {
  EXPECT_STREQ(sds_client_status_name(0), "SDS_ERROR_NONE");
  EXPECT_STREQ(sds_client_status_name(-1), "SDS_ERROR_UNKNOWN");
  EXPECT_STREQ(sds_client_status_name(22), "SDS_ERROR_UNKNOWN");
  EXPECT_STREQ(sds_client_status_meaning(22), "a status number the service does not use");
}

}  // namespace
