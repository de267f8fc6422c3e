// The start-page preview of a deck: one self-contained HTML file (inline CSS,
// icons as data: URIs, no fetch of anything) that shows the tiles the way a
// browser's start page would, in the order given. It takes what the service
// stored at face value only where that is safe: colours are used only when
// they are plain hex colours, links only for http and https, and every text
// is escaped, so a hostile item list can spoil a tile but never the page.
#pragma once

#include <cstddef>
#include <cstdint>
#include <ctime>

// One tile as the service stores it. Null texts were not stored; `png` (with
// `png_size` bytes) is the icon, null for an item without one.
struct sds_page_tile {
  int32_t id = 0;
  const char* url = nullptr;
  const char* title = nullptr;
  const char* dominant_color = nullptr;
  const unsigned char* png = nullptr;
  size_t png_size = 0;
};

// The colour a tile gets when its stored colour is missing or unusable.
constexpr uint8_t SDS_PAGE_NEUTRAL_RGB[3] = {0x5f, 0x63, 0x68};

// True for exactly "#RGB" or "#RRGGBB" (hex digits of either case), with the
// colour in `rgb`; false leaves `rgb` untouched.
bool sds_page_parse_color(const char* text, uint8_t rgb[3]);

// The text colour with the higher contrast on `rgb`: "#000000" or "#ffffff".
const char* sds_page_ink_for(const uint8_t rgb[3]);

// True when `url` may become a link: an absolute http or https URL with a host.
bool sds_page_url_linkable(const char* url);

// The text a tile shows as its name, malloc'ed: the title, or the URL's host
// when there is no title, or the URL itself, or "" when there is neither.
// Invalid UTF-8 is repaired, not escaped. Null only when memory ran out.
char* sds_page_display_title(const char* title, const char* url);

// `text` made valid UTF-8 and escaped for HTML text and quoted attributes,
// malloc'ed. Null only when memory ran out.
char* sds_page_escape(const char* text);

// Where the deck on the page came from, for its header: `origin` a sentence
// such as "from a pull for Cape Town, stored ..." (null: not told), and how
// many withdrawn sites the page leaves out.
struct sds_page_source {
  const char* origin = nullptr;
  size_t withdrawn = 0;
};

// Builds the page for `count` tiles in the given order, stamped with
// `rendered_at`; each linked tile shows its site's host under its title.
// Returns SDS_ERROR_NONE with `*html` malloc'ed (owned by the caller);
// SDS_ERROR_OUT_OF_MEMORY or SDS_ERROR_INVALID_PARAMETER (no `html`, or no
// `tiles` for a count above 0) leave it untouched.
int sds_page_render(const sds_page_tile* tiles, size_t count, const sds_page_source& source,
                    time_t rendered_at, char** html);

// Writes `html` to OUT_DIR/index.html, creating `out_dir` (and its parents)
// when missing. The page appears whole or not at all: it is written to a
// temporary file beside it and renamed. Returns SDS_ERROR_NONE with the
// absolute path of the page in `*written_path` (malloc'ed); SDS_ERROR_IO_ERROR
// with a reason in `*reason` (malloc'ed, may stay null); or
// SDS_ERROR_INVALID_PARAMETER / SDS_ERROR_OUT_OF_MEMORY.
int sds_page_write(const char* out_dir, const char* html, char** written_path, char** reason);
