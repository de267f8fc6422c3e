// Item-list and icon answers of the content server, and its settings.
#include "content-server.h"

#include <glib.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <memory>

#include "icons.h"
#include "stand-in-server.h"

namespace {

constexpr long kMaxSynthesisedItems = 100000;
constexpr size_t kHugeChunk = 64 * 1024;

std::string md5_hex(const std::string& text) {
  gchar* digest =
      g_compute_checksum_for_string(G_CHECKSUM_MD5, text.data(), static_cast<gssize>(text.size()));
  std::string hex = digest != nullptr ? digest : "";
  g_free(digest);
  return hex;
}

// `text` with every %XX escape decoded; a '%' without two hex digits stays.
std::string percent_decoded(const std::string& text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '%' && i + 2 < text.size() && std::isxdigit(static_cast<unsigned char>(text[i + 1])) &&
        std::isxdigit(static_cast<unsigned char>(text[i + 2]))) {
      out.push_back(static_cast<char>(std::stoi(text.substr(i + 1, 2), nullptr, 16)));
      i += 2;
    } else {
      out.push_back(text[i]);
    }
  }
  return out;
}

// Value of `name` in a raw query ("a=1&b=2&"), decoded, or empty. The
// signature is checked over the raw query first, as a real server would.
std::string query_value(const std::string& query, const std::string& name) {
  size_t start = 0;
  while (start <= query.size()) {
    size_t end = query.find('&', start);
    if (end == std::string::npos) end = query.size();
    const std::string part = query.substr(start, end - start);
    if (part.size() > name.size() && part.compare(0, name.size() + 1, name + "=") == 0) {
      return percent_decoded(part.substr(name.size() + 1));
    }
    start = end + 1;
  }
  return std::string();
}

// The signed text is everything before the last "&hash=", and the digest is
// MD5 of that text followed directly by the shared key.
bool signature_valid(const std::string& query, const std::string& key) {
  const size_t mark = query.rfind("&hash=");
  if (mark == std::string::npos) return false;
  const std::string given = query.substr(mark + 6);
  return !given.empty() && given == md5_hex(query.substr(0, mark) + key);
}

bool is_item_list_path(const std::string& path, const std::string& configured) {
  return path.size() >= configured.size() &&
         path.compare(path.size() - configured.size(), configured.size(), configured) == 0;
}

// Spends one use of a status or body fault; the last use clears both.
void consume_fault(cs_server* s) {
  std::lock_guard<std::mutex> lock(s->mutex);
  if (s->faults.times > 0 && --s->faults.times == 0) {
    s->faults.status = 200;
    s->faults.body = cs_body_fault::none;
  }
}

void set_caching_headers(httplib::Response& res, const cs_faults& f, const std::string& etag) {
  if (f.etag == "normal") {
    res.set_header(f.lower_names ? "etag" : "ETag", etag);
  } else if (f.etag == "lower") {
    res.set_header("etag", etag);
  }
  const char* cache_control = f.lower_names ? "cache-control" : "Cache-Control";
  if (f.cache_control.empty()) {
    res.set_header(cache_control, "max-age=" + std::to_string(f.max_age));
  } else if (f.cache_control != "none") {
    res.set_header(cache_control, f.cache_control);
  }
}

void answer_body_fault(httplib::Response& res, const cs_faults& f, const std::string& json) {
  auto body = std::make_shared<std::string>(json);
  const size_t half = body->size() / 2;
  if (f.body == cs_body_fault::huge) {
    const size_t total = std::max(body->size(), static_cast<size_t>(f.huge_mb) * 1024 * 1024);
    // The list followed by spaces: still one valid JSON document, just very long.
    res.set_content_provider(
        total, "application/json", [body](size_t offset, size_t length, httplib::DataSink& sink) {
          if (offset < body->size()) {
            return sink.write(body->data() + offset, std::min(length, body->size() - offset));
          }
          static const std::string spaces(kHugeChunk, ' ');
          return sink.write(spaces.data(), std::min(length, spaces.size()));
        });
    return;
  }
  if (f.body == cs_body_fault::drip) {
    // The whole list, one byte at a time: fast enough for any stall guard
    // that asks for a byte a second, slow enough to take hours.
    const long drip_ms = f.drip_ms;
    res.set_content_provider(body->size(), "application/json",
                             [body, drip_ms](size_t offset, size_t, httplib::DataSink& sink) {
                               if (offset > 0 && !standin_wait_ms(drip_ms)) return false;
                               return sink.write(body->data() + offset, 1);
                             });
    return;
  }
  const bool stall = f.body == cs_body_fault::stall;
  const long stall_ms = f.stall_s * 1000;
  res.set_content_provider(
      body->size(), "application/json",
      [body, half, stall, stall_ms](size_t offset, size_t, httplib::DataSink& sink) {
        if (offset < half) return sink.write(body->data() + offset, half - offset);
        // Returning false makes the library close the connection mid-body.
        if (stall) (void)standin_wait_ms(stall_ms);
        return false;
      });
}

void handle_item_list(cs_server* s, const httplib::Request& req, httplib::Response& res) {
  const std::string query = standin_raw_query(req);
  cs_faults f;
  std::string key;
  {
    std::lock_guard<std::mutex> lock(s->mutex);
    ++s->stats.item_list_requests;
    s->stats.last_path = req.path;
    s->stats.last_query = query;
    s->stats.last_if_none_match = req.get_header_value("If-None-Match");
    s->stats.last_user_agent = req.get_header_value("User-Agent");
    f = s->faults;
    key = s->key;
  }
  if (f.delay_ms > 0) (void)standin_wait_ms(f.delay_ms);

  if (f.status != 200) {
    consume_fault(s);
    res.status = f.status;
    if (f.status >= 300 && f.status < 400 && !f.location.empty()) {
      res.set_header(f.lower_names ? "location" : "Location", f.location);
    }
    if (f.status == 304) {
      cs_faults no_etag = f;  // a forced 304 has no list, so no ETag to send
      no_etag.etag = "none";
      set_caching_headers(res, no_etag, std::string());
    } else {
      res.set_content("status " + std::to_string(f.status) + "\n", "text/plain");
    }
    return;
  }
  if (!signature_valid(query, key)) {
    res.status = 403;
    res.set_content("signature mismatch\n", "text/plain");
    return;
  }
  const std::string city = query_value(query, "city");
  const std::string province = query_value(query, "province");
  std::string json;
  {
    std::lock_guard<std::mutex> lock(s->mutex);
    json = cs_item_list_json(s->current, "http://127.0.0.1:" + std::to_string(s->port) + "/icons",
                             city, province);
  }
  const std::string etag = "\"" + md5_hex(json) + "\"";
  set_caching_headers(res, f, etag);
  if (req.get_header_value("If-None-Match") == etag) {
    res.status = 304;
    return;
  }
  res.status = 200;
  if (f.body == cs_body_fault::none) {
    res.set_content(json, "application/json");
    return;
  }
  consume_fault(s);
  answer_body_fault(res, f, json);
}

void handle_icon(cs_server* s, const httplib::Request& req, httplib::Response& res) {
  const std::string file = req.matches[1];
  cs_icon_fault fault = cs_icon_fault::none;
  long delay_ms = 0;
  cs_icon icon;
  bool known = false;
  std::string cached;
  {
    std::lock_guard<std::mutex> lock(s->mutex);
    ++s->stats.icon_requests;
    s->stats.last_icon = file;
    delay_ms = s->faults.delay_ms;
    const auto found = s->faults.icons.find(file);
    if (found != s->faults.icons.end()) fault = found->second;
    const cs_icon* listed = cs_catalogue_find_icon(s->current, file);
    if (listed == nullptr) listed = cs_catalogue_find_icon(s->initial, file);
    if (listed != nullptr) {
      known = true;
      icon = *listed;
      const auto hit = s->icon_cache.find(file);
      if (hit != s->icon_cache.end() && hit->second.first == icon.generation) {
        cached = hit->second.second;
      }
    }
  }
  if (delay_ms > 0) (void)standin_wait_ms(delay_ms);
  if (fault == cs_icon_fault::huge) {
    res.set_content(cs_huge_dimension_png(), "image/png");
    return;
  }
  if (fault == cs_icon_fault::garbage) {
    res.set_content("<html><body>This is not an image.</body></html>\n", "text/html");
    return;
  }
  if (!known || fault == cs_icon_fault::not_found) {
    res.status = 404;
    res.set_content("<html><body><h1>404 Not Found</h1></body></html>\n", "text/html");
    return;
  }
  if (fault == cs_icon_fault::bomb) {
    // A real PNG of a few KiB whose pixels fill 4 MiB.
    icon.pixels = 1024;
    std::string bomb;
    if (!cs_render_icon_png(icon, &bomb)) {
      res.status = 500;
      return;
    }
    res.set_content(bomb, "image/png");
    return;
  }
  if (cached.empty()) {
    if (!cs_render_icon_png(icon, &cached)) {
      res.status = 500;
      return;
    }
    std::lock_guard<std::mutex> lock(s->mutex);
    s->icon_cache[file] = {icon.generation, cached};
  }
  res.set_content(fault == cs_icon_fault::truncated ? cs_truncate_png(cached) : cached,
                  "image/png");
}

std::string stats_text(cs_server* s) {
  std::lock_guard<std::mutex> lock(s->mutex);
  const cs_stats& st = s->stats;
  return "item_list_requests: " + std::to_string(st.item_list_requests) + "\n" +
         "icon_requests: " + std::to_string(st.icon_requests) + "\n" +
         "version: " + std::to_string(s->current.version) + "\n" + "last_path: " + st.last_path +
         "\n" + "last_query: " + st.last_query + "\n" +
         "last_if_none_match: " + st.last_if_none_match + "\n" +
         "last_user_agent: " + st.last_user_agent + "\n" + "last_icon: " + st.last_icon + "\n";
}

std::string set_catalogue(cs_server* s, const std::string& key, const std::string& value) {
  if (!s->prepared) {
    s->pending.emplace_back(key, value);
    return std::string();
  }
  cs_catalogue* c = &s->current;
  bool done = true;
  if (key == "reverse") {
    cs_catalogue_reverse(c);
  } else if (key == "bump") {
    ++c->version;
  } else if (key == "remove") {
    done = cs_catalogue_remove(c, value);
  } else if (key == "add") {
    done = cs_catalogue_add(c, value);
  } else if (key == "specially_removed") {
    done = cs_catalogue_mark_removed(c, value);
  } else {
    done = cs_catalogue_touch(c, value);
  }
  return done ? std::string() : "no such site (or, for add, already listed)";
}

std::string set_locked(cs_server* s, const std::string& key, const std::string& value) {
  cs_faults& f = s->faults;
  long n = 0;
  const auto number = [&](long lo, long hi, long* out) -> std::string {
    if (!standin_parse_long(value, lo, hi, &n)) {
      return "expects a number from " + std::to_string(lo) + " to " + std::to_string(hi);
    }
    *out = n;
    return std::string();
  };
  if (key == "key" || key == "path") {
    if (value.empty() || (key == "path" && value[0] != '/')) return "bad value";
    (key == "key" ? s->key : s->path) = value;
    return std::string();
  }
  if (key == "catalogue" || key == "items") {
    if (s->prepared) return "only at start-up";
    if (key == "catalogue") {
      s->catalogue_file = value;
      return std::string();
    }
    return number(1, kMaxSynthesisedItems, &s->items);
  }
  if (key == "status") {
    long status = 0;
    std::string why = number(100, 599, &status);
    if (why.empty()) f.status = static_cast<int>(status);
    return why;
  }
  if (key == "location") {
    f.location = value;
    return std::string();
  }
  if (key == "body") {
    static const std::map<std::string, cs_body_fault> kBodies = {{"normal", cs_body_fault::none},
                                                                 {"stall", cs_body_fault::stall},
                                                                 {"cut", cs_body_fault::cut},
                                                                 {"huge", cs_body_fault::huge},
                                                                 {"drip", cs_body_fault::drip}};
    const auto found = kBodies.find(value);
    if (found == kBodies.end()) return "expects normal, stall, cut, huge or drip";
    f.body = found->second;
    return std::string();
  }
  if (key == "times") return number(0, 1000000, &f.times);
  if (key == "delay_ms") return number(0, 600000, &f.delay_ms);
  if (key == "stall_s") return number(1, 600, &f.stall_s);
  if (key == "huge_mb") return number(1, 4096, &f.huge_mb);
  if (key == "drip_ms") return number(1, 600000, &f.drip_ms);
  if (key == "header_case") {
    if (value != "normal" && value != "lower") return "expects normal or lower";
    f.lower_names = value == "lower";
    return std::string();
  }
  if (key == "max_age") return number(-1000000000, 1000000000, &f.max_age);
  if (key == "etag") {
    if (value != "normal" && value != "none" && value != "lower") {
      return "expects normal, none or lower";
    }
    f.etag = value;
    return std::string();
  }
  if (key == "cache_control") {
    f.cache_control = value;
    return std::string();
  }
  static const std::map<std::string, cs_icon_fault> kIconFaults = {
      {"icon_ok", cs_icon_fault::none},
      {"icon_404", cs_icon_fault::not_found},
      {"icon_garbage", cs_icon_fault::garbage},
      {"icon_huge", cs_icon_fault::huge},
      {"icon_truncated", cs_icon_fault::truncated},
      {"icon_bomb", cs_icon_fault::bomb}};
  const auto icon_fault = kIconFaults.find(key);
  if (icon_fault != kIconFaults.end()) {
    if (value.empty()) return "expects an icon file";
    if (icon_fault->second == cs_icon_fault::none) {
      f.icons.erase(value);
    } else {
      f.icons[value] = icon_fault->second;
    }
    return std::string();
  }
  if (key == "reverse" || key == "bump" || key == "remove" || key == "add" ||
      key == "specially_removed" || key == "touch") {
    return set_catalogue(s, key, value);
  }
  return "unknown setting";
}

}  // namespace

std::string cs_server_set(cs_server* server, const std::string& key, const std::string& value) {
  std::lock_guard<std::mutex> lock(server->mutex);
  return set_locked(server, key, value);
}

bool cs_server_prepare(cs_server* server) {
  std::lock_guard<std::mutex> lock(server->mutex);
  if (server->items > 0) {
    server->current = cs_catalogue_synthesise(static_cast<int>(server->items));
  } else {
    std::string error;
    if (!cs_catalogue_load(server->catalogue_file, &server->current, &error)) {
      std::fprintf(stderr, "sitedeck-content-server: %s\n", error.c_str());
      return false;
    }
    // Small catalogues are rendered up front, so a bad icon shows at start.
    for (const cs_site& site : server->current.sites) {
      for (const cs_icon& icon : site.icons) {
        std::string png;
        if (!cs_render_icon_png(icon, &png)) {
          std::fprintf(stderr, "sitedeck-content-server: cannot render %s\n", icon.file.c_str());
          return false;
        }
        server->icon_cache[icon.file] = {icon.generation, std::move(png)};
      }
    }
  }
  server->prepared = true;
  for (const auto& [key, value] : server->pending) {
    const std::string why = set_locked(server, key, value);
    if (!why.empty()) {
      std::fprintf(stderr, "sitedeck-content-server: --%s %s: %s\n", key.c_str(), value.c_str(),
                   why.c_str());
      return false;
    }
  }
  server->pending.clear();
  server->initial = server->current;
  server->initial_faults = server->faults;
  return true;
}

void cs_server_add_routes(httplib::Server& svr, const std::shared_ptr<cs_server>& server) {
  standin_control control;
  control.set = [server](const std::string& key, const std::string& value) {
    return cs_server_set(server.get(), key, value);
  };
  control.reset = [server] {
    std::lock_guard<std::mutex> lock(server->mutex);
    server->current = server->initial;
    server->faults = server->initial_faults;
    server->stats = cs_stats();
  };
  control.stats = [server] { return stats_text(server.get()); };
  standin_add_control_routes(svr, std::move(control));

  svr.Get(R"(/icons/(.+))", [server](const httplib::Request& req, httplib::Response& res) {
    handle_icon(server.get(), req, res);
  });
  svr.Get(R"(/.*)", [server](const httplib::Request& req, httplib::Response& res) {
    bool listed = false;
    {
      std::lock_guard<std::mutex> lock(server->mutex);
      listed = is_item_list_path(req.path, server->path);
    }
    if (listed) return handle_item_list(server.get(), req, res);
    res.status = 404;
    res.set_content("no such resource\n", "text/plain");
  });
}
