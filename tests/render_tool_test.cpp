// `sitedeck render` end to end: a seeded deck served by the real service
// under the activator, the real tool writing the page, and a real headless
// browser loading it. What the browser made of the page is read back from
// its DOM (tiles, order, titles, decoded icon sizes) and its screenshot
// (the tile colours).
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <map>
#include <regex>
#include <string>
#include <vector>

#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-utils.h"
#include "support/png_maker.h"
#include "support/run_process.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/temp_root.h"

namespace {

constexpr char kChromium[] = "/usr/bin/chromium";
// A browser start is seconds; this bound only stops a hung one.
constexpr int kBrowserTimeoutMs = 120000;

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

SeedItem tile(int id, int order, const char* url, std::optional<std::string> title,
              const char* color) {
  SeedItem item = seed_item(id, url, "", order);
  item.title = std::move(title);
  item.dominant_color = color;
  return item;
}

// Stored pixels as the service keeps them after downloading a real PNG.
void with_icon(SeedItem& item, const PngImage& image) {
  item.icon_data = decoded(png_encode_image(image));
  item.icon_size = std::to_string(image.width) + "x" + std::to_string(image.height);
  item.touch_icon_exists = 1;
}

// An opaque icon of one colour, which stays that exact colour when the
// browser scales it.
PngImage solid_icon(int size, uint8_t red, uint8_t green, uint8_t blue) {
  PngImage image;
  image.width = image.height = size;
  png_fill(image, [&](int, int, int c) -> uint16_t {
    const uint8_t samples[4] = {red, green, blue, 0xff};
    return samples[c];
  });
  return image;
}

// One tile as the browser's DOM shows it.
struct DomTile {
  std::string id, title, loaded, href;
  bool has_letter = false;
};

std::string first_match(const std::string& text, const std::string& pattern) {
  std::smatch match;
  return std::regex_search(text, match, std::regex(pattern)) ? match[1].str() : "";
}

std::vector<DomTile> dom_tiles(const std::string& dom) {
  std::vector<DomTile> tiles;
  const std::string open = "<li class=\"tile\" data-id=\"";
  for (size_t at = dom.find(open); at != std::string::npos;) {
    size_t next = dom.find(open, at + 1);
    std::string li = dom.substr(at, next == std::string::npos ? std::string::npos : next - at);
    DomTile t;
    t.id = first_match(li, "data-id=\"([0-9]+)\"");
    t.title = first_match(li, "<span class=\"title\">([^<]*)</span>");
    t.loaded = first_match(li, "data-loaded=\"([^\"]*)\"");
    t.href = first_match(li, "<a href=\"([^\"]*)\"");
    t.has_letter = li.find("class=\"icon letter\"") != std::string::npos;
    tiles.push_back(t);
    at = next;
  }
  return tiles;
}

// How many pixels of a screenshot have exactly each colour (0xRRGGBB).
std::map<uint32_t, int> colour_counts(const std::string& png) {
  std::map<uint32_t, int> counts;
  std::vector<uint8_t> raw = decoded(png);
  for (size_t i = 0; i + 3 < raw.size(); i += 4) {
    ++counts[uint32_t{raw[i + 2]} << 16 | uint32_t{raw[i + 1]} << 8 | raw[i]];
  }
  return counts;
}

class RenderTool : public ::testing::Test {
 protected:
  ProcessResult sitedeck(const std::vector<std::string>& arguments) {
    std::vector<std::string> argv = {std::string(SITEDECK_BIN_DIR) + "/sitedeck", "--socket",
                                     service_.socket_path()};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return run_process(argv);
  }

  // Loads `page` in the headless browser with `mode` (--dump-dom or
  // --screenshot=PATH). The virtual time budget lets the page finish
  // loading and decoding before the dump, counted in the browser's own
  // clock rather than waited for.
  ProcessResult browse(const std::string& page, const std::string& mode) {
    return run_process(
        {kChromium, "--headless", "--no-sandbox", "--disable-gpu", "--no-first-run",
         "--user-data-dir=" + root_.dir() + "/browser-profile", "--disable-extensions",
         "--disable-background-networking", "--force-color-profile=srgb", "--hide-scrollbars",
         "--window-size=1000,700", "--virtual-time-budget=10000", mode, "file://" + page},
        kBrowserTimeoutMs);
  }

  TempRoot root_;
  ServiceHarness service_;
};

TEST_F(RenderTool, BrowserShowsTheLiveTilesInServerOrder) {
  if (access(kChromium, X_OK) != 0) {
    const char* require = std::getenv("SITEDECK_REQUIRE_BROWSER");
    if (require != nullptr && std::string(require) == "1") {
      FAIL() << kChromium << " is missing and SITEDECK_REQUIRE_BROWSER=1";
    }
    GTEST_SKIP() << kChromium << " is missing";
  }
  // Ids out of step with the order, so that the page's order can only come
  // from order_index.
  SeedItem news = tile(20, 1, "https://news.example/", "News", "#E53935");
  with_icon(news, solid_icon(48, 0xff, 0x00, 0x00));
  SeedItem marked = tile(3, 2, "https://marked.example/", "<b>&\"'", "#1E88E5");
  with_icon(marked, png_pattern(16, 16, 0, 8));
  SeedItem mail = tile(8, 3, "https://mail.example/inbox", "Mail", "#3c3");
  SeedItem gone = tile(5, 4, "https://gone.example/", "Gone", "#FFEB3B");
  gone.is_dirty = -1;
  with_icon(gone, png_pattern(32, 32, 6, 8));
  SeedItem maps = tile(11, 5, "https://maps.example:8443/x", std::nullopt, "tomato");
  with_icon(maps, png_pattern(100, 60, 3, 8));
  SeedItem script = tile(12, 6, "javascript:alert(1)", "Script", "#8E24AA");
  with_icon(script, png_pattern(24, 36, 2, 16));
  ASSERT_TRUE(seed_deck({news, marked, mail, gone, maps, script}));
  ASSERT_TRUE(service_.start_activated(/*once=*/false));

  const std::string out_dir = root_.dir() + "/preview";
  ProcessResult rendered = sitedeck({"render", out_dir});
  ASSERT_TRUE(rendered.finished);
  ASSERT_EQ(rendered.exit_code, 0) << rendered.err << service_.output();
  EXPECT_EQ(rendered.out, out_dir + "/index.html\n");
  EXPECT_EQ(rendered.err, "");
  const std::string page = out_dir + "/index.html";

  ProcessResult dom = browse(page, "--dump-dom");
  ASSERT_TRUE(dom.finished) << dom.err;
  ASSERT_EQ(dom.exit_code, 0) << dom.err;
  EXPECT_NE(dom.out.find("<body data-ready=\"\">"), std::string::npos) << dom.out;
  EXPECT_NE(dom.out.find("<span class=\"count\">5 sites</span>"), std::string::npos);
  // No pull has stored a list in this root; the one withdrawn site is left out.
  EXPECT_NE(dom.out.find("<span class=\"origin\">from the installed default deck (no pull has "
                         "stored a list yet)</span> · <span class=\"withdrawn\">1 withdrawn "
                         "site left out</span>"),
            std::string::npos)
      << dom.out;
  EXPECT_EQ(dom.out.find("gone.example"), std::string::npos);
  EXPECT_EQ(dom.out.find("<b>"), std::string::npos) << "a title became markup";

  struct Expected {
    const char* id;
    const char* title;  // as the DOM serialises the text
    const char* loaded;
    const char* href;
  } expected[] = {
      {"20", "News", "48x48", "https://news.example/"},
      {"3", "&lt;b&gt;&amp;\"'", "16x16", "https://marked.example/"},
      {"8", "Mail", "", "https://mail.example/inbox"},
      {"11", "maps.example", "100x60", "https://maps.example:8443/x"},
      {"12", "Script", "24x36", ""},
  };
  std::vector<DomTile> tiles = dom_tiles(dom.out);
  ASSERT_EQ(tiles.size(), std::size(expected)) << dom.out;
  for (size_t i = 0; i < tiles.size(); ++i) {
    const Expected& e = expected[i];
    EXPECT_EQ(tiles[i].id, e.id) << "tile " << i;
    EXPECT_EQ(tiles[i].title, e.title) << e.id;
    EXPECT_EQ(tiles[i].loaded, e.loaded) << e.id;
    EXPECT_EQ(tiles[i].href, e.href) << e.id;
    EXPECT_EQ(tiles[i].has_letter, std::string(e.loaded).empty()) << e.id;
  }

  const std::string shot = root_.dir() + "/shot.png";
  ProcessResult screenshot = browse(page, "--screenshot=" + shot);
  ASSERT_TRUE(screenshot.finished) << screenshot.err;
  ASSERT_EQ(screenshot.exit_code, 0) << screenshot.err;
  std::map<uint32_t, int> counts = colour_counts(read_file(shot));
  ASSERT_FALSE(counts.empty()) << "the screenshot did not decode";
  // Each live tile's colour fills most of a tile (the unusable "tomato"
  // gives the neutral grey); the removed site's yellow is nowhere.
  for (uint32_t colour : {0xe53935u, 0x1e88e5u, 0x33cc33u, 0x5f6368u, 0x8e24aau}) {
    EXPECT_GE(counts[colour], 2000) << std::hex << colour;
  }
  EXPECT_EQ(counts[0xffeb3b], 0);
  // The red icon shows red at its 56x56 on the page: the stored B,G,R,A
  // bytes reached the PNG in the right order.
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
  ProcessResult result = sitedeck({"render", root_.dir() + "/big"});
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.err,
            "sitedeck: render: the deck has 1001 live sites; the page shows the first 1000\n");
  std::string page = read_file(root_.dir() + "/big/index.html");
  EXPECT_NE(page.find("data-id=\"1000\""), std::string::npos);
  EXPECT_EQ(page.find("data-id=\"1001\""), std::string::npos);
}

// An empty deck gives a page with no tiles; bad usage and a directory that
// cannot be made are told and write nothing.
TEST_F(RenderTool, EmptyDeckBadUsageAndAnUnwritableDirectory) {
  auto usage = [](const std::string& problem) {
    return "sitedeck: render: " + problem +
           "\nusage: sitedeck render OUT_DIR\nTry 'sitedeck render --help' for more information.\n";
  };
  ASSERT_TRUE(seed_deck({}));
  ASSERT_TRUE(service_.start_activated(/*once=*/false));
  const std::string file = root_.dir() + "/plain-file", empty = root_.dir() + "/empty";
  ASSERT_TRUE(write_file(file, "x"));
  struct Case {
    std::vector<std::string> arguments;
    int exit_code;
    std::string out, err;
  } cases[] = {
      {{"render", empty}, 0, empty + "/index.html\n", ""},
      {{"render"}, 2, "", usage("OUT_DIR is missing")},
      {{"render", "a", "b"}, 2, "", usage("unexpected argument b")},
      {{"render", "--bogus"}, 2, "", usage("\"--bogus\" is not a directory name")},
      {{"render", file}, 1, "", "sitedeck: render: cannot create " + file + ": Not a directory\n"},
  };
  for (const auto& c : cases) {
    ProcessResult result = sitedeck(c.arguments);
    ASSERT_TRUE(result.finished) << c.err;
    EXPECT_EQ(result.exit_code, c.exit_code) << c.err;
    EXPECT_EQ(result.err, c.err);
    EXPECT_EQ(result.out, c.out);
  }
  EXPECT_EQ(read_file(file), "x");
  std::string page = read_file(empty + "/index.html");
  EXPECT_NE(page.find("<span class=\"count\">0 sites</span>"), std::string::npos) << page;
  EXPECT_EQ(page.find("<li"), std::string::npos);
}

}  // namespace
