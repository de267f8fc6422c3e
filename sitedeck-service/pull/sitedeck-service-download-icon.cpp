// Icon download: after an item list is parsed, each item keeps one chosen touch
// icon, fetched into the images directory when it differs from the stored one,
// or no icon at all. Downloads run a few at a time over reused connections;
// the outcome per item is the same as fetching them one by one in list order.
// An icon file is written beside its name and renamed into place once the
// transfer completed with a success status, so the images directory never
// holds a partial icon and no symlink there is followed. A failed icon is
// logged with its site, its URL and the reason.
#include "pull/sitedeck-service-download-icon.h"

#include <curl/curl.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db-stmt-cache.h"
#include "pull/sitedeck-service-file-write.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "pull/sitedeck-service-utils.h"

namespace {

// Enough parallel fetches to hide a slow server's latency without hammering it.
constexpr int kMaxParallelDownloads = 6;

struct CurlEasyDeleter {
  void operator()(CURL* c) const noexcept { curl_easy_cleanup(c); }
};
using UniqueCurl = std::unique_ptr<CURL, CurlEasyDeleter>;
struct CurlMultiDeleter {
  void operator()(CURLM* m) const noexcept { (void)curl_multi_cleanup(m); }
};
using UniqueCurlMulti = std::unique_ptr<CURLM, CurlMultiDeleter>;

// One icon file being written; refuses to grow past the icon size limit.
struct IconSink {
  std::unique_ptr<SdsFileBeside> file;
  size_t written = 0;
  bool over = false;
};

size_t write_icon_block(char* data, size_t size, size_t count, void* user) {
  auto* sink = static_cast<IconSink*>(user);
  size_t bytes = size * count;
  if (sink->written + bytes > SDS_MAX_ICON_BYTES) {
    sink->over = true;
    return 0;  // aborts the transfer
  }
  size_t items = std::fwrite(data, size, count, sink->file->get());
  sink->written += items * size;
  return items;
}

// One icon to fetch into its file. Its handle and its open file exist only
// while it runs, so a list of thousands never holds thousands of either.
struct IconTransfer {
  sds_icon* icon = nullptr;
  IconSink sink;
  bool ok = false;
  std::string failure;  // why it failed, for the log
  char error[CURL_ERROR_SIZE] = {};
};

// Judges a finished transfer and, when it completed with a success status,
// puts its file in place; otherwise the partial file goes.
bool finish_transfer(CURL* curl, IconTransfer* t, CURLcode result) {
  std::unique_ptr<SdsFileBeside> file = std::move(t->sink.file);
  if (result != CURLE_OK) {
    SDS_LOGE("[CRITICAL] Failed to perform easy perfomr[%d] \n", static_cast<int>(result));
    if (t->sink.over || result == CURLE_FILESIZE_EXCEEDED) {
      t->failure = "larger than " + std::to_string(SDS_MAX_ICON_BYTES) + " bytes";
    } else if (result == CURLE_OPERATION_TIMEDOUT && sds_pull_ms_left() == 0) {
      t->failure = "the pull's deadline passed";
    } else {
      t->failure = t->error[0] != '\0' ? t->error : curl_easy_strerror(result);
    }
    return false;
  }
  long status = 0;
  CURLcode info = curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
  if (info != CURLE_OK) {
    SDS_LOGE("[CRITICAL] curl_easy_getinfo Failed: CURLINFO_HTTP_CODE with error code[%d] \n",
             static_cast<int>(info));
    t->failure = "no HTTP status";
    return false;
  }
  curl_off_t downloaded = 0;
  info = curl_easy_getinfo(curl, CURLINFO_SIZE_DOWNLOAD_T, &downloaded);
  if (info != CURLE_OK) {
    SDS_LOGE("[CRITICAL] curl_easy_getinfo Failed : CURLINFO_SIZE_DOWNLOAD with error code[%d]",
             static_cast<int>(info));
    t->failure = "no download size";
    return false;
  }
  // An error page is no icon: the download failed, as a broken transfer does.
  if (status < 200 || status > 299) {
    t->failure = "HTTP " + std::to_string(status);
    return false;
  }
  if (!file->commit()) {
    t->failure = std::string("its file could not be written: ") + std::strerror(errno);
    return false;
  }
  return true;
}

// The handles that fetch icons, kMaxParallelDownloads at most. A handle keeps
// its settings (user agent, proxy, limits) from icon to icon, and the multi
// handle keeps the connections, so a connection to a server carries one
// request after another instead of one request each.
class IconFetcher {
 public:
  IconFetcher();
  // Fetches the transfers in list order, at most kMaxParallelDownloads at a
  // time; each ends with `ok` telling whether it completed into its file.
  void run(const std::vector<IconTransfer*>& transfers);

 private:
  // Starts `t` on a free handle; false when it cannot start.
  bool start(IconTransfer* t);
  // A configured handle from the pool, or a new one; null when none can be made.
  CURL* take_handle();
  void give_back(CURL* curl) { idle_.emplace_back(curl); }

  UniqueCurlMulti multi_;
  std::vector<UniqueCurl> idle_;
  std::map<CURL*, IconTransfer*> running_;
};

IconFetcher::IconFetcher() : multi_(curl_multi_init()) {
  if (!multi_) return;
  const auto parallel = static_cast<long>(kMaxParallelDownloads);
  (void)curl_multi_setopt(multi_.get(), CURLMOPT_MAX_TOTAL_CONNECTIONS, parallel);
  (void)curl_multi_setopt(multi_.get(), CURLMOPT_MAX_HOST_CONNECTIONS, parallel);
  // One request at a time on a connection: no pipelining, no multiplexing.
  (void)curl_multi_setopt(multi_.get(), CURLMOPT_PIPELINING, static_cast<long>(CURLPIPE_NOTHING));
}

CURL* IconFetcher::take_handle() {
  if (!idle_.empty()) {
    CURL* curl = idle_.back().release();
    idle_.pop_back();
    return curl;
  }
  UniqueCurl curl(curl_easy_init());
  if (!curl) return nullptr;
  char* user_agent = nullptr;
  char* proxy = nullptr;
  int code = sds_transfer_apply_settings(curl.get(), &user_agent, &proxy);
  // The handle keeps copies of the texts it is given.
  std::free(user_agent);
  std::free(proxy);
  if (code != SDS_ERROR_NONE) return nullptr;
  (void)curl_easy_setopt(curl.get(), CURLOPT_WRITEFUNCTION, write_icon_block);
  (void)curl_easy_setopt(curl.get(), CURLOPT_MAXFILESIZE_LARGE,
                         static_cast<curl_off_t>(SDS_MAX_ICON_BYTES));
  return curl.release();
}

bool IconFetcher::start(IconTransfer* t) {
  UniqueCStr path(get_icon_path(t->icon->icon_path));
  if (!path) {
    t->failure = "its URL names no file";
    return false;
  }
  CURL* curl = take_handle();
  if (curl == nullptr) {
    t->failure = "no transfer handle";
    return false;
  }
  if (!sds_transfer_apply_deadline(curl, SDS_TRANSFER_ICON)) {
    t->failure = "the pull's deadline passed";
    give_back(curl);
    return false;
  }
  t->sink.file = std::make_unique<SdsFileBeside>(path.get());
  if (t->sink.file->get() == nullptr) {
    SDS_LOGE("[CRITICAL]  Unable to open Image File");
    t->failure = std::string("its file could not be made: ") + std::strerror(errno);
    t->sink.file.reset();
    give_back(curl);
    return false;
  }
  (void)curl_easy_setopt(curl, CURLOPT_URL, t->icon->icon_path);
  (void)curl_easy_setopt(curl, CURLOPT_WRITEDATA, &t->sink);
  (void)curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, t->error);
  if (curl_multi_add_handle(multi_.get(), curl) != CURLM_OK) {
    t->failure = "the transfer could not start";
    t->sink.file.reset();
    give_back(curl);
    return false;
  }
  running_[curl] = t;
  return true;
}

void IconFetcher::run(const std::vector<IconTransfer*>& transfers) {
  if (!multi_) return;
  size_t next = 0;
  auto start_more = [&] {
    while (next < transfers.size() && static_cast<int>(running_.size()) < kMaxParallelDownloads) {
      (void)start(transfers[next++]);
    }
  };
  start_more();
  int still_running = 0;
  while (!running_.empty()) {
    if (curl_multi_perform(multi_.get(), &still_running) != CURLM_OK) break;
    int queued = 0;
    while (CURLMsg* msg = curl_multi_info_read(multi_.get(), &queued)) {
      if (msg->msg != CURLMSG_DONE) continue;
      auto found = running_.find(msg->easy_handle);
      if (found == running_.end()) continue;
      CURL* curl = found->first;
      IconTransfer* t = found->second;
      running_.erase(found);
      t->ok = finish_transfer(curl, t, msg->data.result);
      (void)curl_multi_remove_handle(multi_.get(), curl);
      give_back(curl);
    }
    start_more();
    if (running_.empty()) break;
    if (curl_multi_poll(multi_.get(), nullptr, 0, 1000, nullptr) != CURLM_OK) break;
  }
  // Left running only when the multi interface failed: those did not complete.
  for (auto& [curl, t] : running_) {
    t->sink.file.reset();
    t->failure = "the transfer library failed";
    (void)curl_multi_remove_handle(multi_.get(), curl);
    give_back(curl);
  }
  running_.clear();
}

// True when the stored icon of `site_url` has this path and time stamp and
// its pixels are there. A row that has the texts without pixels (a file
// written before the merge stored them only together) gets its icon again.
bool icon_unchanged(const char* site_url, const sds_icon* icon) {
  auto stored_text = [site_url](const char* column) {
    char* text = nullptr;
    if (sds_get_string_for_url_from_db(site_url, &text, column) != SDS_ERROR_NONE) {
      std::free(text);
      text = nullptr;
    }
    return UniqueCStr(text);
  };
  if (icon->icon_path == nullptr) return false;
  UniqueCStr path = stored_text("icon_path");
  if (!path || std::strcmp(path.get(), icon->icon_path) != 0) return false;
  UniqueCStr stamp = stored_text("image_last_updated");
  if (!stamp || std::strcmp(stamp.get(), icon->last_modified) != 0) return false;
  UniqueCStr pixels = stored_text("typeof(icon_data)");
  return pixels && std::strcmp(pixels.get(), "blob") == 0;
}

void drop_icons(sds_item* item) {
  sds_free_icon_list(&item->ps_sds_icon_list);
  item->ps_sds_icon_list = nullptr;
}

}  // namespace

sds_icon* sds_choose_icon(sds_icon* head) {
  sds_icon* administered = nullptr;
  sds_icon* other = nullptr;
  for (sds_icon* icon = head; icon != nullptr; icon = icon->next) {
    sds_icon*& best = icon->is_administered ? administered : other;
    if (best == nullptr || std::atoi(icon->icon_size) > std::atoi(best->icon_size)) best = icon;
  }
  return administered != nullptr ? administered : other;
}

void sds_keep_only_icon(sds_icon** head, sds_icon* chosen) {
  if (head == nullptr) return;
  sds_icon* icon = *head;
  while (icon != nullptr) {
    sds_icon* next = icon->next;
    if (icon != chosen) {
      std::free(icon->icon_path);
      std::free(icon);
    }
    icon = next;
  }
  if (chosen != nullptr) chosen->next = nullptr;
  *head = chosen;
}

int sds_download_icon(sds_icon* icon) {
  if (icon == nullptr) return -1;
  sds_transfer_global_init();
  IconTransfer transfer;
  transfer.icon = icon;
  IconFetcher().run({&transfer});
  return transfer.ok ? 0 : -1;
}

int sds_get_sitedeck_icons(sds_item** head) {
  if (head == nullptr) return 0;
  sds_transfer_global_init();
  // First decide, item by item, what to fetch; then fetch; then prune.
  std::vector<std::pair<sds_item*, IconTransfer*>> pending;
  std::vector<std::unique_ptr<IconTransfer>> transfers;
  std::map<std::string, IconTransfer*> by_url;
  {
    // The change test reads the same two columns for every item: prepare
    // them once, and read in one transaction rather than taking and
    // releasing the file's lock (and checking for a journal) for each read.
    SdsDbStatementScope statements(sds_db_handle);
    SdsDbReadTransaction reading(sds_db_handle);
    for (sds_item* item = *head; item != nullptr; item = item->next) {
      if (item->ps_sds_icon_list == nullptr) continue;
      if (item->is_specially_removed) {
        SDS_LOGE("Item is specially removed from server, hence no need to download Icon");
        drop_icons(item);
        continue;
      }
      sds_icon* chosen = sds_choose_icon(item->ps_sds_icon_list);
      if (item->site_url != nullptr && icon_unchanged(item->site_url, chosen)) {
        SDS_LOGE("Icon last modified time is not changed so not downloading icon");
        drop_icons(item);
        continue;
      }
      sds_keep_only_icon(&item->ps_sds_icon_list, chosen);
      IconTransfer* transfer = nullptr;
      std::string url = chosen->icon_path != nullptr ? chosen->icon_path : "";
      auto same_url = by_url.find(url);
      if (!url.empty() && same_url != by_url.end()) {
        transfer = same_url->second;  // one file serves every item naming this URL
      } else {
        transfers.push_back(std::make_unique<IconTransfer>());
        transfer = transfers.back().get();
        transfer->icon = chosen;
        if (!url.empty()) by_url[url] = transfer;
      }
      pending.emplace_back(item, transfer);
    }
  }
  std::vector<IconTransfer*> in_order;
  in_order.reserve(transfers.size());
  for (auto& t : transfers) in_order.push_back(t.get());
  IconFetcher().run(in_order);

  int result = 0;
  for (auto& [item, transfer] : pending) {
    if (!transfer->ok) {
      SDS_LOGE("[CRITICAL]  Failed to Download the Icon");
      // The item's own icon: a shared transfer's icon may be gone with an earlier item.
      const char* icon_url = item->ps_sds_icon_list->icon_path;
      SDS_LOGE("icon %s of %s not stored: %s", icon_url != nullptr ? icon_url : "(none)",
               item->site_url != nullptr ? item->site_url : "(no URL)", transfer->failure.c_str());
      drop_icons(item);
      result = -1;
    }
  }
  return result;
}
