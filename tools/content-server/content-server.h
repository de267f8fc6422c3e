// The content server's request handling: the signed item-list request with
// its ETag and Cache-Control headers, the icon files, and the fault settings
// that tests change through flags or the control route. All state sits in one
// cs_server guarded by its mutex; handlers run on httplib's worker threads.
#pragma once

#include <httplib.h>

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "catalogue.h"

enum class cs_body_fault { none, stall, cut, huge, drip };
enum class cs_icon_fault { none, not_found, garbage, huge, truncated, bomb };

struct cs_faults {
  int status = 200;      // answer to item-list requests
  std::string location;  // Location of a 3xx answer; empty sends none
  cs_body_fault body = cs_body_fault::none;
  long times = 0;               // the status/body fault serves this many requests; 0 = all
  long delay_ms = 0;            // before every answer but the control routes
  long stall_s = 120;           // how long a stalled body hangs at most
  long huge_mb = 64;            // size of a huge body
  long drip_ms = 1000;          // a dripping body sends one byte per this many ms
  std::string etag = "normal";  // normal, none (no ETag), lower ("etag:" header)
  bool lower_names = false;     // ETag, Cache-Control and Location named in lower case
  long max_age = 3600;
  std::string cache_control;  // sent instead of "max-age=N" when set; "none" omits it
  std::map<std::string, cs_icon_fault> icons;  // by file below /icons/
};

struct cs_stats {
  long item_list_requests = 0;
  long icon_requests = 0;
  std::string last_path;
  std::string last_query;
  std::string last_if_none_match;
  std::string last_user_agent;
  std::string last_icon;
};

struct cs_server {
  std::mutex mutex;
  int port = 0;
  std::string key = "SITEDECKTESTKEY0123456789ABCDEFG";
  std::string path = "/SiteDeck/getSubRegionalItems";
  std::string catalogue_file;  // empty: the default file
  long items = 0;              // > 0: synthesised sites instead of the file
  cs_catalogue initial;
  cs_catalogue current;
  cs_faults initial_faults;
  cs_faults faults;
  cs_stats stats;
  std::map<std::string, std::pair<int, std::string>> icon_cache;  // file -> generation, PNG
  bool prepared = false;
  // Catalogue changes given as flags wait here until the catalogue is loaded.
  std::vector<std::pair<std::string, std::string>> pending;
};

// Applies one setting (flag or control key) to `server`; "" or why it is refused.
// Catalogue changes (reverse, remove, add, specially_removed, touch, bump)
// apply to the current catalogue.
std::string cs_server_set(cs_server* server, const std::string& key, const std::string& value);

// Loads or synthesises the catalogue chosen by the settings and renders its
// icons once. False, after printing why, when that fails.
bool cs_server_prepare(cs_server* server);

// Adds the item-list, icon and control routes.
void cs_server_add_routes(httplib::Server& svr, const std::shared_ptr<cs_server>& server);
