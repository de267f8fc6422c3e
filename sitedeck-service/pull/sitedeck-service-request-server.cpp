// One item-list download: a GET of the signed URL, conditional on the ETag of
// the last list stored, with the answer's headers and body streamed to working
// files. A 200 answer is parsed, its icons fetched and the list merged; only
// then does its ETag become the stored one, so an interrupted pull is repeated
// in full next time. Redirects are left for the pull job to follow. Header
// names are matched without regard to case, as HTTP defines them; values are
// kept byte for byte.
#include <curl/curl.h>
#include <fcntl.h>
#include <strings.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "pull/sitedeck-service-db-merge.h"
#include "pull/sitedeck-service-download-icon.h"
#include "pull/sitedeck-service-file-write.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "pull/sitedeck-service-utils.h"

namespace {

struct CurlEasyDeleter {
  void operator()(CURL* c) const noexcept { curl_easy_cleanup(c); }
};
struct CurlListDeleter {
  void operator()(curl_slist* l) const noexcept { curl_slist_free_all(l); }
};
struct CurlUrlDeleter {
  void operator()(CURLU* u) const noexcept { curl_url_cleanup(u); }
};
struct CurlTextDeleter {
  void operator()(char* t) const noexcept { curl_free(t); }
};
using UniqueCurlText = std::unique_ptr<char, CurlTextDeleter>;

constexpr const char* kIfNoneMatch = "If-None-Match: ";
constexpr const char* kRedirectPath = "SiteDeck/getSubRegionalItems";
// An ETag longer than this is no ETag we can send back.
constexpr size_t kMaxEtagLength = 1024;
// A max-age beyond this many seconds (30 days) is taken as this: a server's
// slip must not keep the browser from asking again for months.
constexpr long long kMaxUpdateSeconds = 30LL * 24 * 60 * 60;

// The URL of the download in progress, against which a relative Location is
// resolved; empty outside a download.
std::string g_request_url;

// A working file with a byte budget: a server cannot fill the disk.
struct BoundedSink {
  FILE* file = nullptr;
  size_t written = 0;
  size_t limit = 0;
  bool over = false;
};

size_t append_bounded(char* data, size_t size, size_t count, void* user) {
  auto* sink = static_cast<BoundedSink*>(user);
  size_t bytes = size * count;
  if (sink->file == nullptr) return 0;
  if (sink->written + bytes > sink->limit) {
    sink->over = true;
    return 0;
  }
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

// The stored ETag's first line, or "" when there is none. A missing file is
// made empty, as the first pull always did; a symlink at its name is not
// followed (the commit of the next ETag replaces it). False when the file is
// there but cannot be read.
bool read_stored_etag(const std::string& path, std::string* etag) {
  etag->clear();
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd && errno == ENOENT) {
    UniqueFd made(open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    return made || errno == EEXIST;
  }
  if (!fd && errno == ELOOP) {
    SDS_LOGE("%s is a symbolic link: no ETag is sent", path.c_str());
    return true;
  }
  if (!fd) return false;
  char buffer[kMaxEtagLength + 1];
  ssize_t length = read(fd.get(), buffer, sizeof buffer);
  if (length < 0) return false;
  size_t end = 0;
  while (end < static_cast<size_t>(length) && buffer[end] != '\r' && buffer[end] != '\n') ++end;
  if (end > kMaxEtagLength) return true;
  etag->assign(buffer, end);
  return true;
}

// When `line` is a header field named `name` (without regard to case), the
// position of its value: after the colon and the blanks that may follow it.
// std::string::npos otherwise.
size_t field_value_at(const std::string& line, const char* name) {
  const size_t n = std::strlen(name);
  if (line.size() <= n || strncasecmp(line.c_str(), name, n) != 0 || line[n] != ':') {
    return std::string::npos;
  }
  size_t at = n + 1;
  while (at < line.size() && (line[at] == ' ' || line[at] == '\t')) ++at;
  return at;
}

bool starts_with(const std::string& text, const char* prefix) {
  return text.compare(0, std::strlen(prefix), prefix) == 0;
}

// The absolute http or https URL a Location names: an absolute one as it
// stands, a relative one resolved against the requested URL (RFC 3986,
// section 5). Empty when there is none.
std::string absolute_location(const std::string& location) {
  if (starts_with(location, "http://") || starts_with(location, "https://")) return location;
  if (location.empty() || g_request_url.empty()) return {};
  std::unique_ptr<CURLU, CurlUrlDeleter> url(curl_url());
  if (!url || curl_url_set(url.get(), CURLUPART_URL, g_request_url.c_str(), 0) != CURLUE_OK ||
      curl_url_set(url.get(), CURLUPART_URL, location.c_str(), 0) != CURLUE_OK) {
    return {};
  }
  char* raw_scheme = nullptr;
  char* raw_resolved = nullptr;
  (void)curl_url_get(url.get(), CURLUPART_SCHEME, &raw_scheme, 0);
  UniqueCurlText scheme(raw_scheme);
  if (!scheme || (std::strcmp(scheme.get(), "http") != 0 && std::strcmp(scheme.get(), "https") != 0)) {
    return {};
  }
  (void)curl_url_get(url.get(), CURLUPART_URL, &raw_resolved, 0);
  UniqueCurlText resolved(raw_resolved);
  return resolved ? std::string(resolved.get()) : std::string();
}

void remember_redirect(const std::string& line, size_t value_at) {
  std::string location = line.substr(value_at);
  size_t end = location.find_first_of("\r\n");
  if (end != std::string::npos) location.resize(end);
  // Only a web URL can become a base URL; anything else is ignored and the
  // attempt counts as failed.
  location = absolute_location(location);
  if (location.empty()) return;
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

// The max-age of a Cache-Control line read as atoi would (blanks, a sign,
// digits; 0 without digits), without overflow: the magnitude stops growing
// once it passes what an int holds.
long long max_age_of(const char* text) {
  while (*text == ' ' || (*text >= '\t' && *text <= '\r')) ++text;
  const bool negative = *text == '-';
  if (*text == '+' || *text == '-') ++text;
  long long value = 0;
  for (; *text >= '0' && *text <= '9'; ++text) {
    if (value <= INT_MAX) value = value * 10 + (*text - '0');
  }
  if (value > INT_MAX) value = INT_MAX;
  return negative ? -value : value;
}

void read_cache_control(const std::string& line) {
  const char* at = strcasestr(line.c_str(), "max-age=");
  if (at == nullptr || at[8] == '\0') return;
  long long seconds = max_age_of(at + 8);
  if (seconds > kMaxUpdateSeconds) {
    SDS_LOGE("max-age beyond %lld seconds: %lld is used", kMaxUpdateSeconds, kMaxUpdateSeconds);
    seconds = kMaxUpdateSeconds;
  }
  SDS_LOGE("Next update duration: %d", static_cast<int>(seconds));
  if (seconds > 0) sds_set_next_update_duration(static_cast<int>(seconds));
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

void set_reason(const char* text) {
  (void)std::snprintf(sds_last_transfer.reason, sizeof sds_last_transfer.reason, "%s", text);
}

// Why a transfer that did not complete failed, in libcurl's words.
void note_failed_transfer(CURLcode code, const char* detail, const BoundedSink& body) {
  if (body.over) {
    (void)std::snprintf(sds_last_transfer.reason, sizeof sds_last_transfer.reason,
                        "the item list is larger than %zu bytes", SDS_MAX_ITEM_LIST_BYTES);
  } else if (code == CURLE_OPERATION_TIMEDOUT && sds_pull_ms_left() == 0) {
    set_reason("the pull's deadline passed");
  } else {
    set_reason(detail[0] != '\0' ? detail : curl_easy_strerror(code));
  }
}

}  // namespace

sds_transfer_outcome sds_last_transfer;
bool sds_pull_stored_list = false;

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
      const size_t location = field_value_at(line, "Location");
      if (location != std::string::npos) {
        remember_redirect(line, location);
        return;
      }
      continue;
    }
    const size_t etag_at = field_value_at(line, "ETag");
    if (etag_at != std::string::npos) {
      std::string pending = sds_path(SDS_ETAG_TO_UPDATE_PATH);
      std::string value = line.substr(etag_at);
      if (!sds_write_file_whole(pending, value.data(), value.size())) {
        SDS_LOGE("Unable to open file = %s", pending.c_str());
        sds_last_error = SDS_ERROR_IO_ERROR;
        return;
      }
    } else if (strcasestr(line.c_str(), "Cache-Control:") != nullptr) {
      read_cache_control(line);
    }
  }
}

int sds_download_and_parse_json_data(const char* url) {
  sds_last_error = SDS_ERROR_NONE;
  sds_last_transfer = {};
  const std::string body_path = sds_path(SDS_JSON_RESPONSE_PATH);
  const std::string header_path = sds_path(SDS_HEADER_RESPONSE_PATH);
  const std::string etag_path = sds_path(SDS_ETAG_PATH);
  const std::string pending_etag_path = sds_path(SDS_ETAG_TO_UPDATE_PATH);

  SdsFileBeside body(body_path);
  if (body.get() == nullptr) {
    SDS_LOGE("Unable to open file = %s", body_path.c_str());
    return SDS_ERROR_IO_ERROR;
  }
  SdsFileBeside header(header_path);
  if (header.get() == nullptr) {
    SDS_LOGE("Unable to open file = %s", header_path.c_str());
    return SDS_ERROR_IO_ERROR;
  }
  std::string stored_etag;
  if (!read_stored_etag(etag_path, &stored_etag)) {
    SDS_LOGE("Unable to open file = %s", etag_path.c_str());
    return SDS_ERROR_IO_ERROR;
  }
  const std::string condition = kIfNoneMatch + stored_etag;

  sds_transfer_global_init();
  std::unique_ptr<CURL, CurlEasyDeleter> curl(curl_easy_init());
  if (!curl) {
    // Without a handle nothing was asked: that is a failed attempt, not success.
    set_reason("no transfer handle");
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
  if (!sds_transfer_apply_deadline(curl.get(), SDS_TRANSFER_ITEM_LIST)) {
    set_reason("the pull's deadline passed");
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return sds_last_error;
  }
  std::unique_ptr<curl_slist, CurlListDeleter> headers(
      curl_slist_append(nullptr, condition.c_str()));
  BoundedSink header_sink{header.get(), 0, SDS_MAX_HEADER_BYTES};
  BoundedSink body_sink{body.get(), 0, SDS_MAX_ITEM_LIST_BYTES};
  char error_text[CURL_ERROR_SIZE] = {};
  CURL* c = curl.get();
  (void)curl_easy_setopt(c, CURLOPT_URL, url);
  (void)curl_easy_setopt(c, CURLOPT_ERRORBUFFER, error_text);
  (void)curl_easy_setopt(c, CURLOPT_HEADERDATA, &header_sink);
  (void)curl_easy_setopt(c, CURLOPT_HEADERFUNCTION, sds_write_header_data);
  (void)curl_easy_setopt(c, CURLOPT_WRITEDATA, &body_sink);
  (void)curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, sds_write_body_data);
  (void)curl_easy_setopt(c, CURLOPT_HTTPHEADER, headers.get());
  (void)curl_easy_setopt(c, CURLOPT_MAXFILESIZE_LARGE,
                         static_cast<curl_off_t>(SDS_MAX_ITEM_LIST_BYTES));
  // One protocol version for every server: answers are read the same way
  // whatever a server or proxy in between would negotiate.
  (void)curl_easy_setopt(c, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_1_1));

  (void)remove_file(sds_path(SDS_NEXT_UPDATE_DURATION_PATH).c_str());
  // A pending ETag left by a pull that was killed belongs to a list that was
  // never stored; an answer without an ETag must not commit it.
  (void)std::remove(pending_etag_path.c_str());

  g_request_url = url != nullptr ? url : "";
  CURLcode performed = curl_easy_perform(c);
  (void)curl_easy_getinfo(c, CURLINFO_TOTAL_TIME, &sds_last_transfer.seconds);
  if (curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &sds_last_transfer.http_status) != CURLE_OK) {
    sds_last_transfer.http_status = 0;
  }
  if (performed == CURLE_FILESIZE_EXCEEDED) body_sink.over = true;
  if (performed != CURLE_OK) {
    g_request_url.clear();
    note_failed_transfer(performed, error_text, body_sink);
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    SDS_LOGE("[CRITICAL] Failed to perform easy perfomr[%d] \n", static_cast<int>(performed));
    return sds_last_error;
  }
  if (!body.commit() || !header.commit()) {
    g_request_url.clear();
    SDS_LOGE("Unable to open file = %s", body_path.c_str());
    sds_last_error = SDS_ERROR_IO_ERROR;
    return sds_last_error;
  }
  sds_parse_header(header_path.c_str(), sds_last_transfer.http_status);
  g_request_url.clear();
  (void)remove_file(header_path.c_str());
  if (sds_last_error == SDS_ERROR_HTTP_OK) {
    sds_parse_json_data(body_path.c_str());
    if (sds_item_list_refusal != nullptr) set_reason(sds_item_list_refusal);
    if (sds_item_list_head != nullptr) (void)sds_drop_unusable_items();
  }
  (void)remove_file(body_path.c_str());

  if (sds_item_list_head != nullptr) {
    // A parse cut short (out of memory) still stores what it got, but that
    // list is not the one the ETag names.
    const bool whole_list = sds_last_error == SDS_ERROR_HTTP_OK;
    int icons = sds_get_sitedeck_icons(&sds_item_list_head);
    int merged = insert_sitedeck_items_in_db(sds_item_list_head);
    // An icon that arrived but could not be stored counts as a failed
    // download: the old ETag stays, so the next pull asks for the whole list
    // and fetches the icon again, mended or not.
    if (sds_merge_refused_icons > 0) icons = -1;
    if (icons != 0) sds_set_next_update_duration(SDS_DEFAULT_UPDATE_SECONDS);
    // The ETag names the list now in the database; committing it any earlier
    // would leave it behind for a list a cut-off pull never stored.
    if (whole_list && icons == 0 && merged != SDS_MERGE_NOT_COMMITTED) {
      (void)remove_file(etag_path.c_str());
      // No pending ETag (the answer had none) leaves no stored one either.
      if (std::rename(pending_etag_path.c_str(), etag_path.c_str()) != 0 && errno != ENOENT) {
        SDS_LOGE("Unable to open file = %s", etag_path.c_str());
      }
    }
    if (merged != SDS_MERGE_NOT_COMMITTED && whole_list) sds_pull_stored_list = true;
    // The table still holds the previous list (locked, read-only or full
    // database): the browser must not be told the pull succeeded.
    if (merged == SDS_MERGE_NOT_COMMITTED && sds_last_error == SDS_ERROR_HTTP_OK) {
      SDS_LOGE("the item list could not be stored");
      set_reason("the item list could not be stored in the database");
      sds_last_error = SDS_ERROR_DISK_BUSY;
    }
    sds_free_item_list();
  }
  (void)std::remove(pending_etag_path.c_str());

  if ((sds_last_error == SDS_ERROR_HTTP_MOVED_PERMANENTLY ||
       sds_last_error == SDS_ERROR_HTTP_FOUND) &&
      sds_redirect_base_url == nullptr) {
    // A redirect without a usable Location leads nowhere: a failed attempt.
    set_reason("a redirect without a usable Location");
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
  }
  return sds_last_error == SDS_ERROR_HTTP_OK ? SDS_ERROR_NONE : sds_last_error;
}
