// sitedeck_pull_floor: the floor of a data pull, one process doing only the
// work no pull can avoid. It fetches the item list, reads it with json-glib,
// picks each item's icon the way the service does, fetches those icons over
// one reused libcurl handle (or `parallel` at a time with the multi
// interface), decodes them to B, G, R, A rows with libpng and writes one row
// per site into a fresh SQLite file in one transaction, with one prepared
// statement. The benchmark starts it once per iteration, as the activator
// starts a service process for every pull.
//
// Usage: sitedeck_pull_floor LIST_URL DB_PATH PARALLEL
// Prints the number of rows stored with an icon; exit status 0 on success.

#include <curl/curl.h>
#include <json-glib/json-glib.h>
#include <png.h>
#include <sqlite3.h>
#include <unistd.h>

#include <csetjmp>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace {

// The service's table, so that the rows cost what the service's rows cost.
constexpr const char* kCreateTable =
    "CREATE TABLE IF NOT EXISTS site_deck(id INTEGER UNIQUE PRIMARY KEY,url TEXT DEFAULT "
    "NULL,title TEXT DEFAULT NULL,favicon_exists  INTEGER DEFAULT 0,dominant_color TEXT DEFAULT "
    "NULL,touch_icon_exists INTEGER DEFAULT 0,touchicon TEXT,is_dirty INTEGER DEFAULT "
    "1,image_last_updated TEXT,icon_size TEXT,icon_path TEXT,icon_data BLOB,order_index INTEGER "
    "DEFAULT 0,sync1 TEXT DEFAULT NULL,sync2 TEXT DEFAULT NULL,sync3 TEXT DEFAULT NULL,sync4 TEXT "
    "DEFAULT NULL)";
constexpr const char* kInsert =
    "INSERT INTO site_deck (url,title,favicon_exists,dominant_color,touch_icon_exists,icon_size,"
    "image_last_updated,icon_path,icon_data,order_index,is_dirty) VALUES (?,?,?,?,?,?,?,?,?,?,?)";

struct CurlDeleter {
  void operator()(CURL* c) const noexcept { curl_easy_cleanup(c); }
};
using Curl = std::unique_ptr<CURL, CurlDeleter>;

struct floor_site {
  std::string url, title, color, icon_url, icon_size, last_modified;
  int favicon = 0, touch = 0, removed = 0;
  std::string png;                  // the fetched icon file
  std::vector<unsigned char> bgra;  // its decoded rows
};

size_t append(char* data, size_t size, size_t count, void* user) {
  static_cast<std::string*>(user)->append(data, size * count);
  return size * count;
}

void setup(CURL* c, const std::string& url, std::string* sink) {
  curl_easy_setopt(c, CURLOPT_URL, url.c_str());
  curl_easy_setopt(c, CURLOPT_PROXY, "");
  curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, append);
  curl_easy_setopt(c, CURLOPT_WRITEDATA, sink);
}

const char* text_member(JsonObject* o, const char* name) {
  JsonNode* n = json_object_get_member(o, name);
  return n != nullptr && JSON_NODE_HOLDS_VALUE(n) && json_node_get_value_type(n) == G_TYPE_STRING
             ? json_node_get_string(n)
             : "";
}

int int_member(JsonObject* o, const char* name) {
  JsonNode* n = json_object_get_member(o, name);
  return n != nullptr && JSON_NODE_HOLDS_VALUE(n) ? static_cast<int>(json_node_get_int(n)) : 0;
}

// The item list's sites with their chosen icon, in list order.
bool read_list(const std::string& body, std::vector<floor_site>* sites) {
  JsonParser* parser = json_parser_new();
  bool ok =
      json_parser_load_from_data(parser, body.data(), static_cast<gssize>(body.size()), nullptr) &&
      JSON_NODE_HOLDS_OBJECT(json_parser_get_root(parser));
  for (const char* section : {"global", "regional"}) {
    if (!ok) break;
    JsonObject* root = json_node_get_object(json_parser_get_root(parser));
    JsonObject* part = json_object_get_object_member(root, section);
    JsonArray* items = part != nullptr ? json_object_get_array_member(part, "items") : nullptr;
    for (guint i = 0; items != nullptr && i < json_array_get_length(items); ++i) {
      JsonObject* element = json_array_get_object_element(items, i);
      GList* names = json_object_get_members(element);
      JsonObject* body_object = json_object_get_object_member(element, (char*)names->data);
      g_list_free(names);
      floor_site site;
      site.url = text_member(body_object, "siteUrl");
      site.title = text_member(body_object, "siteName");
      site.color = text_member(body_object, "predominantColor");
      site.favicon = int_member(body_object, "favIconExists");
      site.touch = int_member(body_object, "touchIconsExists");
      site.removed = int_member(body_object, "isSpeciallyRemoved");
      JsonArray* icons = json_object_get_array_member(body_object, "touchIcons");
      JsonObject* best[2] = {nullptr, nullptr};  // [administered]
      for (guint k = 0; icons != nullptr && k < json_array_get_length(icons); ++k) {
        JsonObject* icon = json_array_get_object_element(icons, k);
        JsonObject*& slot = best[int_member(icon, "isAdministered") != 0];
        if (slot == nullptr ||
            std::atoi(text_member(icon, "iconSize")) > std::atoi(text_member(slot, "iconSize"))) {
          slot = icon;
        }
      }
      if (JsonObject* chosen = best[1] != nullptr ? best[1] : best[0]) {
        site.icon_url = text_member(chosen, "iconPath");
        site.icon_size = text_member(chosen, "iconSize");
        site.last_modified = text_member(chosen, "lastModified");
      }
      sites->push_back(std::move(site));
    }
  }
  g_object_unref(parser);
  return ok;
}

bool fetch_one_by_one(CURL* c, std::vector<floor_site>* sites) {
  for (floor_site& site : *sites) {
    if (site.icon_url.empty() || site.removed) continue;
    setup(c, site.icon_url, &site.png);
    if (curl_easy_perform(c) != CURLE_OK) return false;
  }
  return true;
}

bool fetch_parallel(int parallel, std::vector<floor_site>* sites) {
  CURLM* multi = curl_multi_init();
  curl_multi_setopt(multi, CURLMOPT_MAX_HOST_CONNECTIONS, static_cast<long>(parallel));
  std::vector<Curl> idle;
  for (int i = 0; i < parallel; ++i) idle.emplace_back(curl_easy_init());
  size_t next = 0;
  int running = 0;
  bool ok = true;
  auto start_more = [&] {
    while (!idle.empty() && next < sites->size()) {
      floor_site& site = (*sites)[next++];
      if (site.icon_url.empty() || site.removed) continue;
      CURL* c = idle.back().release();
      idle.pop_back();
      setup(c, site.icon_url, &site.png);
      curl_multi_add_handle(multi, c);
      ++running;
    }
  };
  start_more();
  while (running > 0 && ok) {
    int still = 0;
    ok = curl_multi_perform(multi, &still) == CURLM_OK;
    int queued = 0;
    while (CURLMsg* msg = curl_multi_info_read(multi, &queued)) {
      if (msg->msg != CURLMSG_DONE) continue;
      ok = ok && msg->data.result == CURLE_OK;
      curl_multi_remove_handle(multi, msg->easy_handle);
      idle.emplace_back(msg->easy_handle);
      --running;
    }
    start_more();
    if (running > 0 && ok) ok = curl_multi_poll(multi, nullptr, 0, 1000, nullptr) == CURLM_OK;
  }
  curl_multi_cleanup(multi);
  return ok && running == 0;
}

struct png_reader {
  const std::string* png;
  size_t at;
};

void read_bytes(png_structp png, png_bytep out, png_size_t length) {
  auto* reader = static_cast<png_reader*>(png_get_io_ptr(png));
  if (reader->at + length > reader->png->size()) png_error(png, "short");
  std::memcpy(out, reader->png->data() + reader->at, length);
  reader->at += length;
}

// The PNG to B, G, R, A rows with the same transformations the service asks for.
bool decode(floor_site* site) {
  png_structp png = png_create_read_struct(PNG_LIBPNG_VER_STRING, nullptr, nullptr, nullptr);
  png_infop info = png_create_info_struct(png);
  png_reader reader{&site->png, 0};
  std::vector<png_bytep> rows;  // before setjmp: a longjmp must not skip its destructor
  if (setjmp(png_jmpbuf(png))) {
    png_destroy_read_struct(&png, &info, nullptr);
    return false;
  }
  png_set_read_fn(png, &reader, read_bytes);
  png_read_info(png, info);
  int type = png_get_color_type(png, info);
  int depth = png_get_bit_depth(png, info);
  png_uint_32 height = png_get_image_height(png, info);
  if (png_get_valid(png, info, PNG_INFO_tRNS)) png_set_tRNS_to_alpha(png);
  if (type == PNG_COLOR_TYPE_GRAY || type == PNG_COLOR_TYPE_GRAY_ALPHA) png_set_gray_to_rgb(png);
  if (type == PNG_COLOR_TYPE_PALETTE) png_set_palette_to_rgb(png);
  if (type == PNG_COLOR_TYPE_PALETTE || type == PNG_COLOR_TYPE_RGB) {
    png_set_add_alpha(png, 0xFF, PNG_FILLER_AFTER);
  }
  if (depth < 8) png_set_packing(png);
  if (depth > 8) png_set_strip_16(png);
  png_set_bgr(png);
  png_read_update_info(png, info);
  size_t row_bytes = png_get_rowbytes(png, info);
  site->bgra.resize(row_bytes * height);
  rows.resize(height);
  for (png_uint_32 y = 0; y < height; ++y) rows[y] = site->bgra.data() + y * row_bytes;
  png_read_image(png, rows.data());
  png_destroy_read_struct(&png, &info, nullptr);
  return true;
}

// Binds a text without copying it; "" when it is empty, as the service does.
void bind_text(sqlite3_stmt* s, int index, const std::string& text) {
  sqlite3_bind_text(s, index, text.c_str(), static_cast<int>(text.size()), SQLITE_STATIC);
}

int store(const std::string& path, const std::vector<floor_site>& sites) {
  (void)unlink(path.c_str());
  sqlite3* db = nullptr;
  if (sqlite3_open(path.c_str(), &db) != SQLITE_OK) {
    sqlite3_close(db);
    return -1;
  }
  sqlite3_stmt* insert = nullptr;
  bool ok = sqlite3_exec(db, kCreateTable, nullptr, nullptr, nullptr) == SQLITE_OK &&
            sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr) == SQLITE_OK &&
            sqlite3_prepare_v2(db, kInsert, -1, &insert, nullptr) == SQLITE_OK;
  int with_icon = 0;
  int order = 0;
  for (const floor_site& site : sites) {
    if (!ok) break;
    sqlite3_reset(insert);
    bind_text(insert, 1, site.url);
    bind_text(insert, 2, site.title.empty() ? site.url : site.title);
    sqlite3_bind_int(insert, 3, site.favicon);
    bind_text(insert, 4, site.color);
    sqlite3_bind_int(insert, 5, site.touch);
    bind_text(insert, 6, site.icon_size);
    bind_text(insert, 7, site.last_modified);
    bind_text(insert, 8, site.icon_url);
    if (site.bgra.empty()) {
      sqlite3_bind_null(insert, 9);
    } else {
      sqlite3_bind_blob(insert, 9, site.bgra.data(), static_cast<int>(site.bgra.size()),
                        SQLITE_STATIC);
      ++with_icon;
    }
    sqlite3_bind_int(insert, 10, ++order);
    sqlite3_bind_int(insert, 11, site.removed ? -1 : 1);
    ok = sqlite3_step(insert) == SQLITE_DONE;
  }
  sqlite3_finalize(insert);
  ok = ok && sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr) == SQLITE_OK;
  sqlite3_close(db);
  return ok ? with_icon : -1;
}

struct pull_floor_config {
  std::string list_url;
  std::string db_path;  // removed and made anew
  int parallel = 1;     // 1: one reused easy handle; more: multi, this many at a time
};

// One pull; the number of rows stored with an icon, or -1 (reason on stderr).
int pull_floor_run(const pull_floor_config& config) {
  Curl curl(curl_easy_init());
  std::string body;
  setup(curl.get(), config.list_url, &body);
  if (!curl || curl_easy_perform(curl.get()) != CURLE_OK) {
    std::fprintf(stderr, "pull floor: item list not fetched\n");
    return -1;
  }
  std::vector<floor_site> sites;
  if (!read_list(body, &sites)) {
    std::fprintf(stderr, "pull floor: item list not readable\n");
    return -1;
  }
  bool fetched = config.parallel > 1 ? fetch_parallel(config.parallel, &sites)
                                     : fetch_one_by_one(curl.get(), &sites);
  if (!fetched) {
    std::fprintf(stderr, "pull floor: an icon was not fetched\n");
    return -1;
  }
  for (floor_site& site : sites) {
    if (!site.png.empty() && !decode(&site)) {
      std::fprintf(stderr, "pull floor: %s is no PNG\n", site.icon_url.c_str());
      return -1;
    }
    std::string().swap(site.png);
  }
  return store(config.db_path, sites);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 4) {
    std::fprintf(stderr, "usage: sitedeck_pull_floor LIST_URL DB_PATH PARALLEL\n");
    return 2;
  }
  int stored = pull_floor_run({argv[1], argv[2], std::atoi(argv[3])});
  if (stored < 0) return 1;
  std::printf("%d\n", stored);
  return 0;
}
