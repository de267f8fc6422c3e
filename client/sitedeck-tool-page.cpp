// Building the start-page preview: validation of what goes into the page
// (colours, links, texts) and the HTML itself. Everything from the service
// passes through sds_page_escape or a validator before it reaches the page.
#include "sitedeck-tool-page.h"

#include <glib.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <string>

#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"

namespace {

struct GFreeDeleter {
  void operator()(void* p) const noexcept { g_free(p); }
};
using GText = std::unique_ptr<gchar, GFreeDeleter>;

struct GUriUnref {
  void operator()(GUri* uri) const noexcept { g_uri_unref(uri); }
};
using GUriOwner = std::unique_ptr<GUri, GUriUnref>;

// The stylesheet: a responsive grid that keeps the given order, each tile
// painted in its own colour (--tile) with text in --tile-ink.
constexpr char kStyle[] =
    ":root{color-scheme:light dark;--page:#f3f4f6;--ink:#1f2328;--muted:#59636e}"
    "@media (prefers-color-scheme:dark){:root{--page:#17191c;--ink:#e6e8eb;--muted:#9aa4ae}}"
    "*{box-sizing:border-box}"
    "body{margin:0;background:var(--page);color:var(--ink);"
    "font:15px/1.35 system-ui,-apple-system,\"Segoe UI\",Roboto,\"DejaVu Sans\",sans-serif}"
    "header,main{max-width:980px;margin:0 auto;padding:0 20px}"
    "header{padding-top:28px}"
    "h1{margin:0;font-size:24px;font-weight:650}"
    "header p{margin:4px 0 0;color:var(--muted)}"
    ".deck{list-style:none;margin:0;padding:18px 0 40px;display:grid;gap:16px;"
    "grid-template-columns:repeat(auto-fill,minmax(136px,1fr))}"
    ".tile{background:var(--tile);color:var(--tile-ink);border-radius:16px;"
    "box-shadow:0 1px 3px rgba(0,0,0,.2);overflow:hidden}"
    ".tile>a,.tile>div{display:flex;flex-direction:column;align-items:center;gap:10px;"
    "height:100%;padding:18px 10px 14px;color:inherit;text-decoration:none}"
    ".tile>a:hover .title{text-decoration:underline}"
    ".tile>a:focus-visible{outline:3px solid currentColor;outline-offset:-6px;border-radius:16px}"
    ".icon{width:64px;height:64px;flex:none;border-radius:14px;display:grid;place-items:center;"
    "background:#fff;overflow:hidden}"
    ".icon img{width:56px;height:56px;object-fit:contain}"
    ".icon.letter{background:transparent;border:2px solid currentColor;font-size:30px;"
    "font-weight:700}"
    ".title{font-weight:600;text-align:center;overflow-wrap:anywhere;display:-webkit-box;"
    "-webkit-line-clamp:2;-webkit-box-orient:vertical;overflow:hidden}"
    ".host{font-size:12px;opacity:.8;overflow-wrap:anywhere;text-align:center}"
    ".empty{color:var(--muted);padding:18px 0}";

// Marks each icon with the size it decoded to (data-loaded="WxH", or
// "error") and the body with data-ready once all are done, so that a test
// can read from the page what the browser made of it. The page works the
// same without it.
constexpr char kScript[] =
    "(function(){var images=document.querySelectorAll('img');var left=images.length;"
    "function settle(){if(--left<=0)document.body.setAttribute('data-ready','');}"
    "if(left===0)document.body.setAttribute('data-ready','');"
    "images.forEach(function(img){"
    "function loaded(){img.setAttribute('data-loaded',img.naturalWidth+'x'+img.naturalHeight);"
    "settle();}"
    "function failed(){img.setAttribute('data-loaded','error');settle();}"
    "if(img.complete){if(img.naturalWidth>0)loaded();else failed();}"
    "else{img.addEventListener('load',loaded);img.addEventListener('error',failed);}});})();";

int __hex_digit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// WCAG relative luminance of an sRGB colour.
double __luminance(const uint8_t rgb[3]) {
  static constexpr double kWeights[3] = {0.2126, 0.7152, 0.0722};
  double sum = 0;
  for (int i = 0; i < 3; ++i) {
    double c = rgb[i] / 255.0;
    sum += kWeights[i] * (c <= 0.03928 ? c / 12.92 : std::pow((c + 0.055) / 1.055, 2.4));
  }
  return sum;
}

// The letter that stands in for a missing icon: the first non-blank
// character of the name, upper-cased; "?" when there is none.
std::string __placeholder_letter(const char* name) {
  for (const char* p = name; *p != '\0'; p = g_utf8_next_char(p)) {
    gunichar c = g_utf8_get_char(p);
    if (g_unichar_isspace(c)) continue;
    char buffer[8] = {};
    int length = g_unichar_to_utf8(g_unichar_toupper(c), buffer);
    GText escaped(g_markup_escape_text(buffer, length));
    return escaped.get();
  }
  return "?";
}

std::string __escaped(const char* text) {
  UniqueCStr escaped(sds_page_escape(text));
  if (!escaped) throw std::bad_alloc();
  return escaped.get();
}

void __append_tile(std::string& out, const sds_page_tile& tile) {
  uint8_t rgb[3] = {SDS_PAGE_NEUTRAL_RGB[0], SDS_PAGE_NEUTRAL_RGB[1], SDS_PAGE_NEUTRAL_RGB[2]};
  (void)sds_page_parse_color(tile.dominant_color, rgb);
  char color[8];
  (void)std::snprintf(color, sizeof color, "#%02x%02x%02x", rgb[0], rgb[1], rgb[2]);

  UniqueCStr name(sds_page_display_title(tile.title, tile.url));
  if (!name) throw std::bad_alloc();
  bool linked = sds_page_url_linkable(tile.url);

  out += "<li class=\"tile\" data-id=\"" + std::to_string(tile.id) + "\" style=\"--tile:" + color +
         ";--tile-ink:" + sds_page_ink_for(rgb) + "\">";
  out += linked ? "<a href=\"" + __escaped(tile.url) + "\">" : std::string("<div>");
  if (tile.png != nullptr && tile.png_size > 0) {
    GText base64(g_base64_encode(tile.png, tile.png_size));
    out += "<span class=\"icon\"><img alt=\"\" src=\"data:image/png;base64,";
    out += base64.get();
    out += "\"></span>";
  } else {
    out += "<span class=\"icon letter\" aria-hidden=\"true\">" + __placeholder_letter(name.get()) +
           "</span>";
  }
  out += "<span class=\"title\">" + __escaped(name.get()) + "</span>";
  if (linked) {
    // The site's address, under a title that is not the address already.
    GUriOwner uri(g_uri_parse(tile.url, G_URI_FLAGS_NONE, nullptr));
    const char* host = uri ? g_uri_get_host(uri.get()) : nullptr;
    if (host != nullptr && std::strcmp(host, name.get()) != 0) {
      out += "<span class=\"host\">" + __escaped(host) + "</span>";
    }
  }
  out += linked ? "</a>" : "</div>";
  out += "</li>\n";
}

std::string __build_page(const sds_page_tile* tiles, size_t count, const sds_page_source& source,
                         time_t rendered_at) {
  struct tm when {};
  (void)gmtime_r(&rendered_at, &when);
  char shown[32] = "", stamp[32] = "";
  (void)std::strftime(shown, sizeof shown, "%Y-%m-%d %H:%M UTC", &when);
  (void)std::strftime(stamp, sizeof stamp, "%Y-%m-%dT%H:%M:%SZ", &when);
  std::string sites = std::to_string(count) + (count == 1 ? " site" : " sites");

  std::string out =
      "<!DOCTYPE html>\n<html lang=\"en\">\n<head>\n<meta charset=\"utf-8\">\n"
      "<meta name=\"viewport\" content=\"width=device-width, initial-scale=1\">\n"
      // Nothing may leave the file: images only from data: URIs, no other
      // fetches at all, even if a text slipped through unescaped.
      "<meta http-equiv=\"Content-Security-Policy\" content=\"default-src 'none'; "
      "img-src data:; style-src 'unsafe-inline'; script-src 'unsafe-inline'\">\n"
      "<title>Site deck</title>\n<style>";
  out += kStyle;
  out += "</style>\n</head>\n<body>\n<header><h1>Site deck</h1><p><span class=\"count\">" + sites +
         "</span> &middot; rendered <time datetime=\"" + stamp + "\">" + shown + "</time>";
  if (source.origin != nullptr) {
    out += " &middot; <span class=\"origin\">" + __escaped(source.origin) + "</span>";
  }
  if (source.withdrawn > 0) {
    out += " &middot; <span class=\"withdrawn\">" + std::to_string(source.withdrawn) +
           (source.withdrawn == 1 ? " withdrawn site" : " withdrawn sites") +
           " left out</span>";
  }
  out += "</p></header>\n<main>\n";
  if (count == 0) out += "<p class=\"empty\">The deck has no live sites.</p>\n";
  out += "<ol class=\"deck\">\n";
  for (size_t i = 0; i < count; ++i) __append_tile(out, tiles[i]);
  out += "</ol>\n</main>\n<script>";
  out += kScript;
  out += "</script>\n</body>\n</html>\n";
  return out;
}

}  // namespace

bool sds_page_parse_color(const char* text, uint8_t rgb[3]) {
  if (text == nullptr || rgb == nullptr || text[0] != '#') return false;
  size_t length = strnlen(text, 8);
  if (length != 4 && length != 7) return false;
  int digits[6];
  for (size_t i = 1; i < length; ++i) {
    digits[i - 1] = __hex_digit(text[i]);
    if (digits[i - 1] < 0) return false;
  }
  for (int i = 0; i < 3; ++i) {
    rgb[i] = length == 4 ? static_cast<uint8_t>(digits[i] * 17)
                         : static_cast<uint8_t>(digits[2 * i] * 16 + digits[2 * i + 1]);
  }
  return true;
}

const char* sds_page_ink_for(const uint8_t rgb[3]) {
  double luminance = __luminance(rgb);
  double on_black = (luminance + 0.05) / 0.05;
  double on_white = 1.05 / (luminance + 0.05);
  return on_black >= on_white ? "#000000" : "#ffffff";
}

bool sds_page_url_linkable(const char* url) {
  if (url == nullptr) return false;
  // The parser lets blanks and control characters through, which no site
  // address has and which a browser would quietly rewrite.
  for (const char* p = url; *p != '\0'; ++p) {
    auto c = static_cast<unsigned char>(*p);
    if (c <= 0x20 || c == 0x7f) return false;
  }
  GUriOwner uri(g_uri_parse(url, G_URI_FLAGS_NONE, nullptr));
  if (!uri) return false;
  const char* scheme = g_uri_get_scheme(uri.get());
  const char* host = g_uri_get_host(uri.get());
  return scheme != nullptr &&
         (g_ascii_strcasecmp(scheme, "http") == 0 || g_ascii_strcasecmp(scheme, "https") == 0) &&
         host != nullptr && host[0] != '\0';
}

char* sds_page_display_title(const char* title, const char* url) {
  const char* chosen = "";
  GUriOwner uri;
  if (title != nullptr && title[0] != '\0') {
    chosen = title;
  } else if (url != nullptr && url[0] != '\0') {
    chosen = url;
    uri.reset(g_uri_parse(url, G_URI_FLAGS_NONE, nullptr));
    const char* host = uri ? g_uri_get_host(uri.get()) : nullptr;
    if (host != nullptr && host[0] != '\0') chosen = host;
  }
  GText valid(g_utf8_make_valid(chosen, -1));
  return strdup(valid.get());
}

char* sds_page_escape(const char* text) {
  GText valid(g_utf8_make_valid(text != nullptr ? text : "", -1));
  GText escaped(g_markup_escape_text(valid.get(), -1));
  return strdup(escaped.get());
}

int sds_page_render(const sds_page_tile* tiles, size_t count, const sds_page_source& source,
                    time_t rendered_at, char** html) {
  if (html == nullptr || (tiles == nullptr && count > 0)) return SDS_ERROR_INVALID_PARAMETER;
  try {
    std::string page = __build_page(tiles, count, source, rendered_at);
    char* copy = strdup(page.c_str());
    if (copy == nullptr) return SDS_ERROR_OUT_OF_MEMORY;
    *html = copy;
    return SDS_ERROR_NONE;
  } catch (const std::bad_alloc&) {
    return SDS_ERROR_OUT_OF_MEMORY;
  }
}
