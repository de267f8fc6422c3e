// One item-list download: a GET of the signed URL, conditional on the ETag of
// the last list stored, with the answer's headers and body streamed to working
// files. A 200 answer is parsed, its icons fetched and the list merged; only
// then does its ETag become the stored one, so an interrupted pull is repeated
// in full next time. Redirects are left for the pull job to follow.
#include <curl/curl.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "database/sitedeck-service-db-interface.h"
#include "sitedeck-service-download-icon.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-request-server.h"
#include "sitedeck-service-transfer-limits.h"
#include "sitedeck-service-utils.h"

namespace {

struct CurlEasyDeleter {
  void operator()(CURL* c) const noexcept { curl_easy_cleanup(c); }
};
struct CurlListDeleter {
  void operator()(curl_slist* l) const noexcept { curl_slist_free_all(l); }
};

constexpr const char* kIfNoneMatch = "If-None-Match: ";
constexpr const char* kRedirectPath = "SiteDeck/getSubRegionalItems";
// An ETag longer than this is no ETag we can send back.
constexpr size_t kMaxEtagLength = 1024;

// A working file with a byte budget: a server cannot fill the disk.
struct BoundedSink {
  FILE* file = nullptr;
  size_t written = 0;
  size_t limit = 0;
};

size_t append_bounded(char* data, size_t size, size_t count, void* user) {
  auto* sink = static_cast<BoundedSink*>(user);
  size_t bytes = size * count;
  if (sink->file == nullptr || sink->written + bytes > sink->limit) return 0;
  size_t done = std::fwrite(data, 1, bytes, sink->file);
  sink->written += done;
  return done;
}

// Header and body callbacks: each appends what the library delivers.
size_t sds_write_header_data(char* data, size_t size, size_t count, void* user) {
  return append_bounded(data, size, count, user);
}
size_t sds_write_body_data(char* data, size_t size, size_t count, void* user) {
  return append_bounded(data, size, count, user);
}

// The stored ETag's first line, or "" when there is none.
std::string read_stored_etag(FILE* file) {
  std::string etag;
  int c;
  while ((c = std::fgetc(file)) != EOF && c != '\r' && c != '\n') {
    if (etag.size() >= kMaxEtagLength) return "";
    etag.push_back(static_cast<char>(c));
  }
  return etag;
}

bool starts_with(const std::string& text, const char* prefix) {
  return text.compare(0, std::strlen(prefix), prefix) == 0;
}

void remember_redirect(const std::string& line) {
  std::string location = line.substr(std::strlen("Location: "));
  size_t end = location.find_first_of("\r\n");
  if (end != std::string::npos) location.resize(end);
  // Only an absolute web URL can become a base URL; anything else is ignored
  // and the attempt counts as failed.
  if (!starts_with(location, "http://") && !starts_with(location, "https://")) return;
  SDS_LOGE("Redirected Processed url = \"%s\"\n", location.c_str());
  std::string base = location + kRedirectPath;
  char* copy = strdup(base.c_str());
  if (copy == nullptr) {
    SDS_LOGE("[Critical] Failed to calloc to url");
    return;
  }
  sds_redirect_base_url = copy;
  SDS_LOGE("Base url for redirected url = \"%s\"\n", sds_redirect_base_url);
}

// Reads one header line, without a length limit beyond the header file's own.
bool read_line(FILE* file, std::string* line) {
  line->clear();
  int c;
  while ((c = std::fgetc(file)) != EOF) {
    line->push_back(static_cast<char>(c));
    if (c == '\n') break;
  }
  return !line->empty();
}

}  // namespace

void sds_parse_header(const char* path, long http_status) {
  if (path == nullptr) {
    SDS_LOGE("[ERROR] why file == NULL?");
    sds_last_error = SDS_ERROR_DATA_PULL_FAILED;
    return;
  }
  if (http_status == 200 || http_status == 304) {
    sds_last_error = http_status == 200 ? SDS_ERROR_HTTP_OK : SDS_ERROR_HTTP_NOT_MODIFIED;
  } else if (http_status == 301 || http_status == 302) {
    sds_last_error =
        http_status == 301 ? SDS_ERROR_HTTP_MOVED_PERMANENTLY : SDS_ERROR_HTTP_FOUND;
    // A base URL from an earlier answer must never be taken for this one's.
    std::free(sds_redirect_base_url);
    sds_redirect_base_url = nullptr;
  } else {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return;
  }
  UniqueFile headers(std::fopen(path, "r"));
  if (!headers) {
    SDS_LOGE("Unable to open file = %s", path);
    sds_last_error = SDS_ERROR_IO_ERROR;
    return;
  }
  std::string line;
  const bool redirect = http_status == 301 || http_status == 302;
  while (read_line(headers.get(), &line)) {
    if (redirect) {
      if (starts_with(line, "Location: ")) {
        remember_redirect(line);
        return;
      }
      continue;
    }
    if (starts_with(line, "ETag: ")) {
      std::string pending = sds_path(SDS_ETAG_TO_UPDATE_PATH);
      UniqueFile etag(std::fopen(pending.c_str(), "w"));
      if (!etag) {
        SDS_LOGE("Unable to open file = %s", pending.c_str());
        sds_last_error = SDS_ERROR_IO_ERROR;
        return;
      }
      std::string value = line.substr(6);
      bool ok = std::fwrite(value.data(), 1, value.size(), etag.get()) == value.size();
      if (std::fclose(etag.release()) != 0 || !ok) {
        SDS_LOGE("Unable to open file = %s", pending.c_str());
        sds_last_error = SDS_ERROR_IO_ERROR;
        return;
      }
    } else if (line.find("Cache-Control:") != std::string::npos) {
      size_t at = line.find("max-age=");
      if (at != std::string::npos && at + 8 < line.size()) {
        int seconds = std::atoi(line.c_str() + at + 8);
        SDS_LOGE("Next update duration: %d", seconds);
        if (seconds > 0) sds_set_next_update_duration(seconds);
      }
    }
  }
}

int sds_download_and_parse_json_data(const char* url) {
  sds_last_error = SDS_ERROR_NONE;
  const std::string body_path = sds_path(SDS_JSON_RESPONSE_PATH);
  const std::string header_path = sds_path(SDS_HEADER_RESPONSE_PATH);
  const std::string etag_path = sds_path(SDS_ETAG_PATH);
  const std::string pending_etag_path = sds_path(SDS_ETAG_TO_UPDATE_PATH);

  UniqueFile body(std::fopen(body_path.c_str(), "w+"));
  if (!body) {
    SDS_LOGE("Unable to open file = %s", body_path.c_str());
    return SDS_ERROR_IO_ERROR;
  }
  UniqueFile header(std::fopen(header_path.c_str(), "w+"));
  if (!header) {
    SDS_LOGE("Unable to open file = %s", header_path.c_str());
    return SDS_ERROR_IO_ERROR;
  }
  std::string condition = kIfNoneMatch;
  {
    UniqueFile etag(std::fopen(etag_path.c_str(), "a+"));
    if (!etag) {
      SDS_LOGE("Unable to open file = %s", etag_path.c_str());
      return SDS_ERROR_IO_ERROR;
    }
    std::rewind(etag.get());
    condition += read_stored_etag(etag.get());
  }

  sds_transfer_global_init();
  std::unique_ptr<CURL, CurlEasyDeleter> curl(curl_easy_init());
  if (!curl) {
    // Without a handle nothing was asked: that is a failed attempt, not success.
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return sds_last_error;
  }
  char* user_agent_text = nullptr;
  char* proxy_text = nullptr;
  int settings = sds_transfer_apply_settings(curl.get(), &user_agent_text, &proxy_text);
  UniqueCStr user_agent(user_agent_text);
  UniqueCStr proxy(proxy_text);
  if (settings != SDS_ERROR_NONE) {
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    return sds_last_error;
  }
  std::unique_ptr<curl_slist, CurlListDeleter> headers(
      curl_slist_append(nullptr, condition.c_str()));
  BoundedSink header_sink{header.get(), 0, SDS_MAX_HEADER_BYTES};
  BoundedSink body_sink{body.get(), 0, SDS_MAX_ITEM_LIST_BYTES};
  CURL* c = curl.get();
  (void)curl_easy_setopt(c, CURLOPT_URL, url);
  (void)curl_easy_setopt(c, CURLOPT_HEADERDATA, &header_sink);
  (void)curl_easy_setopt(c, CURLOPT_HEADERFUNCTION, sds_write_header_data);
  (void)curl_easy_setopt(c, CURLOPT_WRITEDATA, &body_sink);
  (void)curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, sds_write_body_data);
  (void)curl_easy_setopt(c, CURLOPT_HTTPHEADER, headers.get());
  (void)curl_easy_setopt(c, CURLOPT_MAXFILESIZE_LARGE,
                         static_cast<curl_off_t>(SDS_MAX_ITEM_LIST_BYTES));
  // Header names are matched as HTTP/1.1 servers write them ("ETag: ").
  (void)curl_easy_setopt(c, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_1_1));

  (void)remove_file(sds_path(SDS_NEXT_UPDATE_DURATION_PATH).c_str());
  // A pending ETag left by a pull that was killed belongs to a list that was
  // never stored; an answer without an ETag must not commit it.
  (void)std::remove(pending_etag_path.c_str());

  CURLcode performed = curl_easy_perform(c);
  if (performed != CURLE_OK) {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    SDS_LOGE("[CRITICAL] Failed to perform easy perfomr[%d] \n", static_cast<int>(performed));
    return sds_last_error;
  }
  bool files_ok = std::fclose(body.release()) == 0;
  files_ok = (std::fclose(header.release()) == 0) && files_ok;
  if (!files_ok) {
    SDS_LOGE("Unable to open file = %s", body_path.c_str());
    sds_last_error = SDS_ERROR_IO_ERROR;
    return sds_last_error;
  }
  long status = 0;
  if (curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &status) != CURLE_OK) status = 0;
  sds_parse_header(header_path.c_str(), status);
  (void)remove_file(header_path.c_str());
  if (sds_last_error == SDS_ERROR_HTTP_OK) sds_parse_json_data(body_path.c_str());
  (void)remove_file(body_path.c_str());

  if (sds_item_list_head != nullptr) {
    // A parse cut short (out of memory) still stores what it got, but that
    // list is not the one the ETag names.
    const bool whole_list = sds_last_error == SDS_ERROR_HTTP_OK;
    int icons = sds_get_sitedeck_icons(&sds_item_list_head);
    if (icons != 0) sds_set_next_update_duration(SDS_DEFAULT_UPDATE_SECONDS);
    int merged = insert_sitedeck_items_in_db(sds_item_list_head);
    // The ETag names the list now in the database; committing it any earlier
    // would leave it behind for a list a cut-off pull never stored.
    if (whole_list && icons == 0 && merged != SDS_MERGE_NOT_COMMITTED) {
      (void)remove_file(etag_path.c_str());
      // No pending ETag (the answer had none) leaves no stored one either.
      if (std::rename(pending_etag_path.c_str(), etag_path.c_str()) != 0 && errno != ENOENT) {
        SDS_LOGE("Unable to open file = %s", etag_path.c_str());
      }
    }
    // The table still holds the previous list (locked, read-only or full
    // database): the browser must not be told the pull succeeded.
    if (merged == SDS_MERGE_NOT_COMMITTED && sds_last_error == SDS_ERROR_HTTP_OK) {
      SDS_LOGE("the item list could not be stored");
      sds_last_error = SDS_ERROR_DISK_BUSY;
    }
    sds_free_item_list();
  }
  (void)std::remove(pending_etag_path.c_str());

  if ((sds_last_error == SDS_ERROR_HTTP_MOVED_PERMANENTLY ||
       sds_last_error == SDS_ERROR_HTTP_FOUND) &&
      sds_redirect_base_url == nullptr) {
    // A redirect without a usable Location leads nowhere: a failed attempt.
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
  }
  return sds_last_error == SDS_ERROR_HTTP_OK ? SDS_ERROR_NONE : sds_last_error;
}
