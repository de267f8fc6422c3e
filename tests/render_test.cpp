// `sitedeck render` end to end: a seeded deck served by the real service, the
// real tool writing the page, and a real headless browser loading it, whose
// DOM (tiles, order, titles, decoded icon sizes) and screenshot (the tile
// colours) are read back. Before it, what from the item list may become a
// link or a colour on the page at all.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <map>
#include <regex>
#include <string>
#include <vector>

#include "pull/sitedeck-service-utils.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-tool-page.h"
#include "support/png_maker.h"
#include "support/run_process.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/temp_root.h"

namespace {

TEST(RenderPage, OnlyHttpAndHttpsUrlsBecomeLinksAndOnlyPlainHexColoursAreUsed) {
  for (const char* url : {"http://a.example/", "https://a.example/x?y=1&z=2#top", "HTTPS://A.EXAMPLE",
                          "http://127.0.0.1:8080/", "https://[::1]/"}) {
    EXPECT_TRUE(sds_page_url_linkable(url)) << url;
  }
  for (const char* url :
       {"javascript:alert(1)", "JavaScript://a.example/%0Aalert(1)", "data:text/html,hi",
        "vbscript:msgbox", "ftp://a.example/", "file:///etc/passwd", "//a.example/", "/relative",
        "a.example", "https://", "http:///path", "https://a b.example/", " https://a.example/",
        "https://a.example/\n", "https://a.example/\x7f", "", static_cast<const char*>(nullptr)}) {
    EXPECT_FALSE(sds_page_url_linkable(url)) << (url != nullptr ? url : "(null)");
  }
  uint8_t rgb[3] = {1, 2, 3};
  for (const char* refused : {"", "abc", "#ab", "#abcd", "#12345", "#1234567", "#ggg", " #abc",
                              "#abc ", "red", "#abc\"><script>", static_cast<const char*>(nullptr)}) {
    EXPECT_FALSE(sds_page_parse_color(refused, rgb)) << (refused != nullptr ? refused : "(null)");
  }
  EXPECT_EQ(std::vector<uint8_t>(rgb, rgb + 3), (std::vector<uint8_t>{1, 2, 3})) << "a refusal wrote";
}

// A PNG decoded by the service's own code: B,G,R,A bytes, empty on failure.
std::vector<uint8_t> decoded(const std::string& png) {
  unsigned char* raw = nullptr;
  int w = 0, h = 0, size = 0;
  if (convert_png_to_raw_data(reinterpret_cast<const unsigned char*>(png.data()), png.size(), &raw,
                              &w, &h, &size) != 0) {
    return {};
  }
  UniqueMalloc<unsigned char> owner(raw);
  return std::vector<uint8_t>(raw, raw + size);
}

// A tile with stored pixels as the service keeps them after downloading `icon`.
SeedItem tile(int id, int order, const char* url, std::optional<std::string> title,
              const char* color, const PngImage* icon = nullptr) {
  SeedItem item = seed_item(id, url, "", order);
  item.title = std::move(title);
  item.dominant_color = color;
  if (icon != nullptr) {
    item.icon_data = decoded(png_encode_image(*icon));
    item.icon_size = std::to_string(icon->width) + "x" + std::to_string(icon->height);
    item.touch_icon_exists = 1;
  }
  return item;
}

class RenderTool : public ::testing::Test {
 protected:
  ProcessResult render(const std::vector<std::string>& arguments) {
    std::vector<std::string> argv = {SITEDECK_BIN_DIR "/sitedeck", "--socket", service_.socket_path(),
                                     "render"};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return run_process(argv);
  }
  TempRoot root_;
  ServiceHarness service_;
};

TEST_F(RenderTool, BrowserShowsTheLiveTilesInServerOrder) {
  constexpr char kChromium[] = "/usr/bin/chromium";
  if (access(kChromium, X_OK) != 0) {
    const char* require = std::getenv("SITEDECK_REQUIRE_BROWSER");
    if (require != nullptr && std::string(require) == "1") FAIL() << kChromium << " is missing";
    GTEST_SKIP() << kChromium << " is missing";
  }
  // An opaque red icon stays that exact colour when the browser scales it.
  PngImage red;
  red.width = red.height = 48;
  png_fill(red, [](int, int, int c) -> uint16_t { return c == 0 || c == 3 ? 0xff : 0; });
  const PngImage grey = png_pattern(16, 16, 0, 8), rgba = png_pattern(32, 32, 6, 8),
                 palette = png_pattern(100, 60, 3, 8), deep = png_pattern(24, 36, 2, 16);
  // Ids out of step with the order: the page's order can only come from order_index.
  SeedItem gone = tile(5, 4, "https://gone.example/", "Gone", "#FFEB3B", &rgba);
  gone.is_dirty = -1;
  ASSERT_TRUE(seed_deck({tile(20, 1, "https://news.example/", "News", "#E53935", &red),
                         tile(3, 2, "https://marked.example/", "<b>&\"'", "#1E88E5", &grey),
                         tile(8, 3, "https://mail.example/inbox", "Mail", "#3c3"), gone,
                         tile(11, 5, "https://maps.example:8443/x", std::nullopt, "tomato", &palette),
                         tile(12, 6, "javascript:alert(1)", "Script", "#8E24AA", &deep)}));
  ASSERT_TRUE(service_.start_activated(/*once=*/false));
  const std::string page = root_.dir() + "/preview/index.html";
  ProcessResult rendered = render({root_.dir() + "/preview"});
  ASSERT_EQ(rendered.exit_code, 0) << rendered.err << service_.output();
  EXPECT_EQ(rendered.out, page + "\n");
  EXPECT_EQ(rendered.err, "");
  // The virtual time budget lets the page load and decode, in the browser's own clock.
  const auto browse = [&](const std::string& mode) {
    return run_process({kChromium, "--headless", "--no-sandbox", "--disable-gpu", "--no-first-run",
                        "--user-data-dir=" + root_.dir() + "/profile", "--disable-extensions",
                        "--disable-background-networking", "--force-color-profile=srgb",
                        "--hide-scrollbars", "--window-size=1000,700", "--virtual-time-budget=10000",
                        mode, "file://" + page},
                       120000);
  };
  ProcessResult dom = browse("--dump-dom");
  ASSERT_EQ(dom.exit_code, 0) << dom.err;
  EXPECT_NE(dom.out.find("<body data-ready=\"\">"), std::string::npos) << dom.out;
  // No pull has stored a list in this root; the one withdrawn site is left out.
  EXPECT_NE(dom.out.find("<span class=\"count\">5 sites</span>"), std::string::npos);
  EXPECT_NE(dom.out.find("<span class=\"origin\">from the installed default deck (no pull has "
                         "stored a list yet)</span> · <span class=\"withdrawn\">1 withdrawn "
                         "site left out</span>"),
            std::string::npos);
  EXPECT_EQ(dom.out.find("gone.example"), std::string::npos);
  EXPECT_EQ(dom.out.find("<b>"), std::string::npos) << "a title became markup";
  // Each tile: id, link, icon size once decoded (or a letter instead), title.
  std::string tiles;
  const std::string open = "<li class=\"tile\" data-id=\"";
  for (size_t at = dom.out.find(open), next; at != std::string::npos; at = next) {
    next = dom.out.find(open, at + 1);
    const std::string li = dom.out.substr(at, next - at);
    const auto field = [&li](const char* pattern) {
      std::smatch m;
      return std::regex_search(li, m, std::regex(pattern)) ? m[1].str() : "";
    };
    tiles += field("data-id=\"([0-9]+)\"") + " " + field("<a href=\"([^\"]*)\"") + " " +
             (li.find("icon letter") != std::string::npos ? "letter"
                                                          : field("data-loaded=\"([^\"]*)\"")) +
             " " + field("<span class=\"title\">([^<]*)</span>") + "\n";
  }
  EXPECT_EQ(tiles,
            "20 https://news.example/ 48x48 News\n"
            "3 https://marked.example/ 16x16 &lt;b&gt;&amp;\"'\n"
            "8 https://mail.example/inbox letter Mail\n"
            "11 https://maps.example:8443/x 100x60 maps.example\n"
            "12  24x36 Script\n");
  const std::string shot = root_.dir() + "/shot.png";
  ASSERT_EQ(browse("--screenshot=" + shot).exit_code, 0);
  std::map<uint32_t, int> counts;  // pixels of each colour, 0xRRGGBB
  const std::vector<uint8_t> raw = decoded(read_file(shot));
  for (size_t i = 0; i + 3 < raw.size(); i += 4) {
    ++counts[uint32_t{raw[i + 2]} << 16 | uint32_t{raw[i + 1]} << 8 | raw[i]];
  }
  ASSERT_FALSE(counts.empty()) << "the screenshot did not decode";
  // Each live tile's colour fills most of a tile (the unusable "tomato"
  // gives the neutral grey); the removed site's yellow is nowhere.
  for (uint32_t colour : {0xe53935u, 0x1e88e5u, 0x33cc33u, 0x5f6368u, 0x8e24aau}) {
    EXPECT_GE(counts[colour], 2000) << std::hex << colour;
  }
  EXPECT_EQ(counts[0xffeb3b], 0);
  // The red icon shows red at its 56x56 on the page: the stored B,G,R,A bytes
  // reached the PNG in the right order.
  EXPECT_GE(counts[0xff0000], 56 * 56 * 3 / 4);
  EXPECT_EQ(counts[0x0000ff], 0);
}

TEST_F(RenderTool, OversizedDeckIsCutToTheFirstThousandTiles) {
  std::vector<SeedItem> items;
  for (int i = 1; i <= 1001; ++i) {
    items.push_back(seed_item(i, "https://site" + std::to_string(i) + ".example/", "S", i));
  }
  ASSERT_TRUE(seed_deck(items));
  ASSERT_TRUE(service_.start_activated(/*once=*/false));
  ProcessResult result = render({root_.dir() + "/big"});
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.err, "sitedeck: render: the deck has 1001 live sites; the page shows the first 1000\n");
  std::string page = read_file(root_.dir() + "/big/index.html");
  EXPECT_NE(page.find("data-id=\"1000\""), std::string::npos);
  EXPECT_EQ(page.find("data-id=\"1001\""), std::string::npos);
}

// An empty deck gives a page with no tiles, written again whole (mode 0644,
// nothing else left in the directory); bad usage and a directory that cannot
// be made are told and write nothing.
TEST_F(RenderTool, EmptyDeckBadUsageAndAnUnwritableDirectory) {
  const auto usage = [](const std::string& problem) {
    return "sitedeck: render: " + problem +
           "\nusage: sitedeck render OUT_DIR\nTry 'sitedeck render --help' for more information.\n";
  };
  ASSERT_TRUE(seed_deck({}));
  ASSERT_TRUE(service_.start_activated(/*once=*/false));
  const std::string file = root_.dir() + "/plain-file", empty = root_.dir() + "/out/empty";
  ASSERT_TRUE(write_file(file, "x"));
  struct Case {
    std::vector<std::string> arguments;
    int exit_code;
    std::string out, err;
  } cases[] = {
      {{empty}, 0, empty + "/index.html\n", ""},
      {{empty}, 0, empty + "/index.html\n", ""},
      {{}, 2, "", usage("OUT_DIR is missing")},
      {{"a", "b"}, 2, "", usage("unexpected argument b")},
      {{"--bogus"}, 2, "", usage("\"--bogus\" is not a directory name")},
      {{file}, 1, "", "sitedeck: render: cannot create " + file + ": Not a directory\n"},
  };
  for (const auto& c : cases) {
    ProcessResult result = render(c.arguments);
    EXPECT_EQ(result.exit_code, c.exit_code) << c.err;
    EXPECT_EQ(result.err, c.err);
    EXPECT_EQ(result.out, c.out);
  }
  EXPECT_EQ(read_file(file), "x");
  const std::string page = read_file(empty + "/index.html");
  EXPECT_NE(page.find("<span class=\"count\">0 sites</span>"), std::string::npos) << page;
  EXPECT_EQ(page.find("<li"), std::string::npos);
  struct stat st {};
  ASSERT_EQ(stat((empty + "/index.html").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(empty), {}), 1);
}

}  // namespace
