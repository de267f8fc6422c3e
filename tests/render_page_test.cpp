// The start-page preview without a browser: what a colour, a URL or a title
// from the item list turns into on the page, the page around the tiles, and
// how the page reaches the disk.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "sitedeck-tool-page.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"
#include "support/temp_root.h"

namespace {

std::string render(const std::vector<sds_page_tile>& tiles, time_t when = 1796571000) {
  char* html = nullptr;
  EXPECT_EQ(sds_page_render(tiles.data(), tiles.size(), {}, when, &html), SDS_ERROR_NONE);
  UniqueCStr owner(html);
  return owner ? owner.get() : "";
}

std::string text_of(char* malloced) {
  UniqueCStr owner(malloced);
  return owner ? owner.get() : "(null)";
}

TEST(RenderPage, OnlyPlainHexColoursAreUsedWithTheInkOfMoreContrast) {
  uint8_t rgb[3] = {1, 2, 3};
  for (const char* refused :
       {"", "abc", "#ab", "#abcd", "#12345", "#1234567", "#ggg", " #abc", "#abc ", "red",
        "#abc\"><script>", static_cast<const char*>(nullptr)}) {
    EXPECT_FALSE(sds_page_parse_color(refused, rgb)) << (refused != nullptr ? refused : "(null)");
  }
  EXPECT_EQ(std::vector<uint8_t>(rgb, rgb + 3), (std::vector<uint8_t>{1, 2, 3}))
      << "a refusal wrote";
  ASSERT_TRUE(sds_page_parse_color("#abc", rgb));
  EXPECT_EQ(std::vector<uint8_t>(rgb, rgb + 3), (std::vector<uint8_t>{0xaa, 0xbb, 0xcc}));
  ASSERT_TRUE(sds_page_parse_color("#A1b2C3", rgb));
  EXPECT_EQ(std::vector<uint8_t>(rgb, rgb + 3), (std::vector<uint8_t>{0xa1, 0xb2, 0xc3}));
  struct Ink {
    uint8_t rgb[3];
    const char* ink;
  } inks[] = {
      {{0xff, 0xff, 0xff}, "#000000"}, {{0, 0, 0}, "#ffffff"},
      {{0xff, 0xff, 0x00}, "#000000"}, {{0x00, 0x00, 0xff}, "#ffffff"},
      {{0xe5, 0x39, 0x35}, "#000000"}, {{0x5f, 0x63, 0x68}, "#ffffff"},
  };
  for (const auto& c : inks) {
    EXPECT_STREQ(sds_page_ink_for(c.rgb), c.ink) << int(c.rgb[0]) << "," << int(c.rgb[1]);
  }
}

TEST(RenderPage, OnlyHttpAndHttpsUrlsBecomeLinks) {
  for (const char* url : {"http://a.example/", "https://a.example/x?y=1&z=2#top",
                          "HTTPS://A.EXAMPLE", "http://127.0.0.1:8080/", "https://[::1]/"}) {
    EXPECT_TRUE(sds_page_url_linkable(url)) << url;
  }
  for (const char* url :
       {"javascript:alert(1)", "JavaScript://a.example/%0Aalert(1)", "data:text/html,hi",
        "vbscript:msgbox", "ftp://a.example/", "file:///etc/passwd", "//a.example/", "/relative",
        "a.example", "https://", "http:///path", "https://a b.example/", " https://a.example/",
        "https://a.example/\n", "https://a.example/\x7f", "", static_cast<const char*>(nullptr)}) {
    EXPECT_FALSE(sds_page_url_linkable(url)) << (url != nullptr ? url : "(null)");
  }
}

TEST(RenderPage, TileNameFallsBackToTheHost) {
  struct Case {
    const char* title;
    const char* url;
    std::string shown;
  } cases[] = {
      {nullptr, "https://www.news.example:8443/a?b", "www.news.example"},
      {"", "http://a.example", "a.example"},
      {nullptr, "not a url", "not a url"},
      {nullptr, nullptr, ""},
      {"Bad \xff title", nullptr, "Bad \xef\xbf\xbd title"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(text_of(sds_page_display_title(c.title, c.url)), c.shown) << c.shown;
  }
}

TEST(RenderPage, TextsAreEscapedAndMadeValid) {
  struct Case {
    const char* text;
    std::string escaped;
  } cases[] = {
      {"plain", "plain"},
      {"</script><img src=x onerror=alert(1)>",
       "&lt;/script&gt;&lt;img src=x onerror=alert(1)&gt;"},
      {"Gr\u00fc\u00dfe", "Gr\u00fc\u00dfe"},
      {"cut \xe2\x82", "cut \xef\xbf\xbd\xef\xbf\xbd"},
      {nullptr, ""},
  };
  for (const auto& c : cases) EXPECT_EQ(text_of(sds_page_escape(c.text)), c.escaped) << c.escaped;
}

TEST(RenderPage, TilesAreWrittenInOrderWithWhatIsSafeOfEachItem) {
  const unsigned char png[] = {'a', 'b', 'c'};
  std::vector<sds_page_tile> tiles(4);
  tiles[0] = {20, "https://news.example/?a=1&b=2", "News", "#E53935", png, sizeof png};
  tiles[1] = {3, "javascript:alert(1)", "<b>&\"'", "#3c3", nullptr, 0};
  tiles[2] = {7, "https://maps.example:8443/x", nullptr, "red;background:url(http://x)", nullptr,
              0};
  tiles[3] = {9, nullptr, "  \xc3\xa9t\xc3\xa9", nullptr, nullptr, 0};
  std::string page = render(tiles);

  const std::string expected =
      "<ol class=\"deck\">\n"
      "<li class=\"tile\" data-id=\"20\" style=\"--tile:#e53935;--tile-ink:#000000\">"
      "<a href=\"https://news.example/?a=1&amp;b=2\"><span class=\"icon\"><img alt=\"\" "
      "src=\"data:image/png;base64,YWJj\"></span><span class=\"title\">News</span>"
      "<span class=\"host\">news.example</span></a></li>\n"
      "<li class=\"tile\" data-id=\"3\" style=\"--tile:#33cc33;--tile-ink:#000000\"><div>"
      "<span class=\"icon letter\" aria-hidden=\"true\">&lt;</span>"
      "<span class=\"title\">&lt;b&gt;&amp;&quot;&apos;</span></div></li>\n"
      "<li class=\"tile\" data-id=\"7\" style=\"--tile:#5f6368;--tile-ink:#ffffff\">"
      "<a href=\"https://maps.example:8443/x\"><span class=\"icon letter\" "
      "aria-hidden=\"true\">M</span><span class=\"title\">maps.example</span></a></li>\n"
      "<li class=\"tile\" data-id=\"9\" style=\"--tile:#5f6368;--tile-ink:#ffffff\"><div>"
      "<span class=\"icon letter\" aria-hidden=\"true\">\xc3\x89</span>"
      "<span class=\"title\">  \xc3\xa9t\xc3\xa9</span></div></li>\n"
      "</ol>\n";
  EXPECT_NE(page.find(expected), std::string::npos) << page;
  EXPECT_NE(page.find("<span class=\"count\">4 sites</span> &middot; rendered <time "
                      "datetime=\"2026-12-06T15:30:00Z\">2026-12-06 15:30 UTC</time>"),
            std::string::npos)
      << page;
  // Self-contained: nothing on the page makes the browser fetch.
  for (const char* fetch : {"src=\"http", "url(", "@import", "<link"}) {
    EXPECT_EQ(page.find(fetch), std::string::npos) << fetch;
  }
}

TEST(RenderPageWrite, CreatesTheDirectoryAndReplacesThePageWhole) {
  TempRoot root;
  const std::string dir = root.dir() + "/out/nested";
  for (const char* html : {"<p>first</p>", "<p>second</p>"}) {
    char* path = nullptr;
    char* reason = nullptr;
    ASSERT_EQ(sds_page_write(dir.c_str(), html, &path, &reason), SDS_ERROR_NONE);
    EXPECT_EQ(text_of(path), dir + "/index.html");
    EXPECT_EQ(reason, nullptr);
    EXPECT_EQ(read_file(dir + "/index.html"), html);
  }
  struct stat st {};
  ASSERT_EQ(stat((dir + "/index.html").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    names.push_back(entry.path().filename().string());
  }
  EXPECT_EQ(names, std::vector<std::string>{"index.html"});
}

}  // namespace
