// `sitedeck status`: what the service has stored, read from the files under
// its data directory alone, so that it works while the service is stopped:
// the servers, the ETag, when the last pull ran and how it ended, when the
// next is due, the position, the items. A file the user may not read is
// told as such (and fails the command), never taken for a missing one.
// It must never change anything there: the server list and the location are
// read with the service's own readers, the database is opened read-only (a
// missing one is reported, never created), and no file is written.
#include "sitedeck-tool-status.h"

#include <json-glib/json-glib.h>
#include <sqlite3.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <string>
#include <vector>

#include "pull/sitedeck-service-file-read.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"
#include "pull/sitedeck-service-xml-read.h"
#include "sitedeck-client-status.h"
#include "sitedeck-tool-last-pull.h"
#include "sitedeck-tool-output.h"
#include "sitedeck-tool.h"

namespace {

// The ETag and the duration are short texts; anything longer is not theirs.
constexpr long kSmallFileCap = 4096;
// Longest wait for a database another process is writing.
constexpr int kBusyWaitMs = 2000;

struct SqliteClose {
  void operator()(sqlite3* db) const noexcept { (void)sqlite3_close(db); }
};
using UniqueSqlite = std::unique_ptr<sqlite3, SqliteClose>;

struct sds_status_server {
  int id = 0;
  std::string base_url;
  int wait_time = 0;
  int retry_count = 0;
  bool fall_back = false;
};

struct sds_status_report {
  std::string data_dir;
  bool have_server_list = false;
  std::vector<sds_status_server> servers;
  bool have_etag = false;
  std::string etag;
  bool have_duration = false;
  bool duration_valid = false;  // the stored text is a number above 0
  std::string duration_text;
  int duration_seconds = SDS_DEFAULT_UPDATE_SECONDS;  // what the service tells the browser
  bool have_location = false;
  std::string position, city, province;
  bool have_database = false;
  std::string database_path, database_problem;
  long long live_items = 0, withdrawn_items = 0;
  time_t modified = 0;
  sds_last_pull last_pull;
  // Files that exist but that this user may not read.
  std::vector<std::string> denied;
};

// True (and noted in the report) when `path` cannot be read for lack of
// permission, on the file or on a directory above it.
bool __denied(sds_status_report* report, const std::string& path) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd >= 0) {
    (void)close(fd);
    return false;
  }
  if (errno != EACCES && errno != EPERM) return false;
  report->denied.push_back(path);
  return true;
}

// The text of a small file with trailing blanks and line ends dropped; false
// when it is missing, unreadable or empty.
bool __read_small_text(sds_status_report* report, const char* fixed_path, std::string* text) {
  const std::string path = sds_path(fixed_path);
  if (__denied(report, path)) return false;
  size_t length = 0;
  UniqueMalloc<char> content(sds_read_file_bounded(path.c_str(), kSmallFileCap, &length));
  if (!content) return false;
  std::string value(content.get(), std::strlen(content.get()));
  while (!value.empty() && std::strchr(" \t\r\n", value.back()) != nullptr) value.pop_back();
  if (value.empty()) return false;
  *text = value;
  return true;
}

void __gather_servers(sds_status_report* report) {
  const std::string path = sds_path(SDS_SERVER_DATA_XML);
  if (__denied(report, path)) return;
  sds_server_list* list = sds_get_server_data(path.c_str());
  report->have_server_list = list != nullptr;
  for (const sds_server_list* node = list; node != nullptr; node = node->next) {
    const sds_server_data* server = node->server;
    if (server == nullptr) continue;
    report->servers.push_back({server->id, server->base_url != nullptr ? server->base_url : "",
                               server->wait_time, server->retry_count, server->fall_back != 0});
  }
  sds_free_server_list(&list);
}

void __gather_duration(sds_status_report* report) {
  report->have_duration =
      __read_small_text(report, SDS_NEXT_UPDATE_DURATION_PATH, &report->duration_text);
  // The service reads the number the same way and falls back below 1.
  if (report->have_duration && std::atoi(report->duration_text.c_str()) > 0) {
    report->duration_seconds = std::atoi(report->duration_text.c_str());
    report->duration_valid = true;
  }
}

std::string __element_text(xmlNode* element) {
  UniqueXmlChar text(xmlNodeGetContent(element));
  return text ? reinterpret_cast<const char*>(text.get()) : "";
}

void __gather_location(sds_status_report* report) {
  const std::string path = sds_path(SDS_LOCATION_INFO_PATH);
  if (__denied(report, path)) return;
  UniqueXmlDoc doc = sds_xml_read_file(path.c_str());
  xmlNode* root = doc ? xmlDocGetRootElement(doc.get()) : nullptr;
  if (root == nullptr || !sds_xml_is_element(root, "Location")) return;
  for (xmlNode* child = root->children; child != nullptr; child = child->next) {
    if (sds_xml_is_element(child, "LatitudeLongitude")) report->position = __element_text(child);
    if (sds_xml_is_element(child, "City")) report->city = __element_text(child);
    if (sds_xml_is_element(child, "Province")) report->province = __element_text(child);
  }
  report->have_location = !report->position.empty();
}

bool __count_items(sqlite3* db, int is_dirty, long long* count) {
  sqlite3_stmt* raw = nullptr;
  if (sqlite3_prepare_v2(db, "SELECT COUNT(*) FROM site_deck WHERE is_dirty = ?", -1, &raw,
                         nullptr) != SQLITE_OK) {
    return false;
  }
  std::unique_ptr<sqlite3_stmt, int (*)(sqlite3_stmt*)> statement(raw, sqlite3_finalize);
  if (sqlite3_bind_int(raw, 1, is_dirty) != SQLITE_OK || sqlite3_step(raw) != SQLITE_ROW) {
    return false;
  }
  *count = sqlite3_column_int64(raw, 0);
  return true;
}

void __gather_database(sds_status_report* report) {
  report->database_path = sds_path(SDS_DB_PATH);
  struct stat info {};
  if (stat(report->database_path.c_str(), &info) != 0 || !S_ISREG(info.st_mode)) return;
  if (__denied(report, report->database_path)) return;
  sqlite3* raw = nullptr;
  int rc = sqlite3_open_v2(report->database_path.c_str(), &raw, SQLITE_OPEN_READONLY, nullptr);
  UniqueSqlite db(raw);
  // A service writing at this moment holds the lock briefly; wait that long.
  if (rc == SQLITE_OK) (void)sqlite3_busy_timeout(raw, kBusyWaitMs);
  if (rc != SQLITE_OK || !__count_items(raw, 1, &report->live_items) ||
      !__count_items(raw, -1, &report->withdrawn_items)) {
    report->database_problem = raw != nullptr ? sqlite3_errmsg(raw) : sqlite3_errstr(rc);
    return;
  }
  report->have_database = true;
  report->modified = info.st_mtime;
}

std::string __time_stamp(time_t when) {
  struct tm local {};
  char text[64] = "";
  if (localtime_r(&when, &local) != nullptr) {
    (void)std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S %Z", &local);
  }
  return text;
}

std::string __server_table(const sds_status_report& report, const sds_tool_settings& settings) {
  sds_tool_table table;
  table.header = {"  ID", "BASE URL", "WAIT", "RETRIES", "FALLBACK"};
  table.shrinkable = {false, true, false, false, false};
  for (const auto& server : report.servers) {
    table.rows.push_back({{"  " + std::to_string(server.id)},
                          {server.base_url},
                          {std::to_string(server.wait_time) + " ms"},
                          {std::to_string(server.retry_count)},
                          {server.fall_back ? "yes" : "no"}});
  }
  return sds_tool_format_table(table, settings);
}

void __print_text(const sds_status_report& report, const sds_tool_settings& settings) {
  // Keys of both blocks line up: "data directory" is the widest.
  constexpr size_t kKeyColumns = sizeof "data directory:" - 1;
  // What the reader of a file the user may not read sees instead of "none".
  auto none = [&report](const char* fixed) {
    const std::string path = sds_path(fixed);
    for (const auto& denied : report.denied) {
      if (denied == path) return std::string("permission denied");
    }
    return std::string("none");
  };
  std::string servers =
      report.have_server_list
          ? std::to_string(report.servers.size()) + " configured"
          : none(SDS_SERVER_DATA_XML) + " (no usable server list at " +
                sds_path(SDS_SERVER_DATA_XML) + ")";
  std::string out = sds_tool_format_fields(
      {{"data directory", {report.data_dir}}, {"servers", {servers}}}, settings, kKeyColumns);
  if (!report.servers.empty()) out += __server_table(report, settings);

  std::vector<std::pair<std::string, sds_tool_cell>> fields;
  fields.push_back({"stored ETag", {report.have_etag ? report.etag : none(SDS_ETAG_PATH)}});
  std::string duration = "none (86400 s is used)";
  if (report.duration_valid) {
    duration = std::to_string(report.duration_seconds) + " s";
  } else if (report.have_duration) {
    duration = "\"" + report.duration_text + "\" is not above 0 (86400 s is used)";
  }
  fields.push_back({"next update", {duration}});
  const sds_last_pull& pull = report.last_pull;
  switch (pull.state) {
    case sds_last_pull_state::present:
      fields.push_back({"last pull", {__time_stamp(pull.time) + ", " +
                                      sds_client_status_name(pull.status)}});
      fields.push_back({"next due", {__time_stamp(pull.time + report.duration_seconds)}});
      break;
    case sds_last_pull_state::missing:
      fields.push_back({"last pull", {"none (no pull has run)"}});
      break;
    case sds_last_pull_state::denied:
      fields.push_back({"last pull", {"permission denied"}});
      break;
    case sds_last_pull_state::unreadable:
      fields.push_back({"last pull", {"unreadable (" + sds_path(SDS_LAST_PULL_PATH) + ")"}});
      break;
  }
  std::string location = none(SDS_LOCATION_INFO_PATH);
  if (report.have_location) {
    location = report.position + " (" + (report.city.empty() ? "?" : report.city) + ", " +
               (report.province.empty() ? "?" : report.province) + ")";
  }
  fields.push_back({"last position", {location}});
  if (report.have_database) {
    fields.push_back({"items",
                      {std::to_string(report.live_items) + " live, " +
                       std::to_string(report.withdrawn_items) + " withdrawn"}});
    fields.push_back({"database",
                      {"modified " + sds_tool_format_age(std::time(nullptr) - report.modified) +
                       " (" + __time_stamp(report.modified) + ")"}});
  } else {
    fields.push_back({"items", {"none"}});
    std::string why = report.database_problem.empty() ? "" : ": " + report.database_problem;
    fields.push_back({"database", {"no database at " + report.database_path + why}});
  }
  out += sds_tool_format_fields(fields, settings, kKeyColumns);
  std::fwrite(out.data(), 1, out.size(), stdout);
}

bool __print_json(const sds_status_report& report) {
  UniqueJsonBuilder json = sds_tool_json_builder();
  JsonBuilder* b = json.get();
  json_builder_begin_object(b);
  sds_tool_json_text(b, "data_directory", report.data_dir.c_str());
  if (report.have_server_list) {
    json_builder_set_member_name(b, "servers");
    json_builder_begin_array(b);
    for (const auto& server : report.servers) {
      json_builder_begin_object(b);
      sds_tool_json_int(b, "id", server.id);
      sds_tool_json_text(b, "base_url", server.base_url.c_str());
      sds_tool_json_int(b, "wait_time_ms", server.wait_time);
      sds_tool_json_int(b, "retry_count", server.retry_count);
      sds_tool_json_bool(b, "fall_back", server.fall_back);
      json_builder_end_object(b);
    }
    json_builder_end_array(b);
  } else {
    sds_tool_json_null(b, "servers");
  }
  sds_tool_json_text(b, "etag", report.have_etag ? report.etag.c_str() : nullptr);
  json_builder_set_member_name(b, "next_update");
  json_builder_begin_object(b);
  sds_tool_json_text(b, "stored", report.have_duration ? report.duration_text.c_str() : nullptr);
  sds_tool_json_int(b, "seconds", report.duration_seconds);
  json_builder_end_object(b);
  const sds_last_pull& pull = report.last_pull;
  if (pull.state == sds_last_pull_state::present) {
    json_builder_set_member_name(b, "last_pull");
    json_builder_begin_object(b);
    sds_tool_json_int(b, "time", static_cast<long long>(pull.time));
    sds_tool_json_int(b, "status", pull.status);
    sds_tool_json_text(b, "name", sds_client_status_name(pull.status));
    json_builder_end_object(b);
    sds_tool_json_int(b, "next_due", static_cast<long long>(pull.time + report.duration_seconds));
  } else {
    sds_tool_json_null(b, "last_pull");
    sds_tool_json_null(b, "next_due");
  }
  json_builder_set_member_name(b, "permission_denied");
  json_builder_begin_array(b);
  for (const auto& path : report.denied) json_builder_add_string_value(b, path.c_str());
  json_builder_end_array(b);
  if (report.have_location) {
    json_builder_set_member_name(b, "location");
    json_builder_begin_object(b);
    sds_tool_json_text(b, "position", report.position.c_str());
    sds_tool_json_text(b, "city", report.city.empty() ? nullptr : report.city.c_str());
    sds_tool_json_text(b, "province", report.province.empty() ? nullptr : report.province.c_str());
    json_builder_end_object(b);
  } else {
    sds_tool_json_null(b, "location");
  }
  if (report.have_database) {
    json_builder_set_member_name(b, "database");
    json_builder_begin_object(b);
    sds_tool_json_text(b, "path", report.database_path.c_str());
    sds_tool_json_int(b, "live_items", report.live_items);
    sds_tool_json_int(b, "withdrawn_items", report.withdrawn_items);
    sds_tool_json_int(b, "modified", static_cast<long long>(report.modified));
    sds_tool_json_int(b, "age_seconds",
                      static_cast<long long>(std::time(nullptr) - report.modified));
    json_builder_end_object(b);
  } else {
    sds_tool_json_null(b, "database");
  }
  json_builder_end_object(b);
  return sds_tool_json_print(b);
}

}  // namespace

std::string sds_tool_format_age(long long seconds) {
  if (seconds < 0) return "in the future";
  constexpr long long kMinute = 60, kHour = 3600, kDay = 86400;
  if (seconds < kMinute) return std::to_string(seconds) + " s ago";
  if (seconds < kHour) return std::to_string(seconds / kMinute) + " min ago";
  if (seconds < kDay) {
    return std::to_string(seconds / kHour) + " h " + std::to_string(seconds % kHour / kMinute) +
           " min ago";
  }
  return std::to_string(seconds / kDay) + " d " + std::to_string(seconds % kDay / kHour) + " h ago";
}

int sds_tool_status(SdsConnection& /*connection*/, int argc, char** /*argv*/) {
  if (argc != 0) return kSdsToolUsage;
  sds_status_report report;
  report.data_dir = sds_path(SDS_DATA_DIR);
  struct stat info {};
  if (stat(report.data_dir.c_str(), &info) != 0 && (errno == EACCES || errno == EPERM)) {
    std::fprintf(stderr, "sitedeck: status: permission denied: cannot reach %s\n",
                 report.data_dir.c_str());
    return kSdsToolReported;
  }
  if (stat(report.data_dir.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
    std::fprintf(stderr, "sitedeck: status: no data directory at %s (is the service installed?)\n",
                 report.data_dir.c_str());
    return kSdsToolReported;
  }
  __gather_servers(&report);
  report.have_etag = __read_small_text(&report, SDS_ETAG_PATH, &report.etag);
  __gather_duration(&report);
  report.last_pull = sds_tool_read_last_pull(sds_path(SDS_LAST_PULL_PATH));
  if (report.last_pull.state == sds_last_pull_state::denied) {
    report.denied.push_back(sds_path(SDS_LAST_PULL_PATH));
  }
  __gather_location(&report);
  __gather_database(&report);
  bool printed = true;
  if (sds_tool_output().json) {
    printed = __print_json(report);
  } else {
    __print_text(report, sds_tool_output());
  }
  if (!report.denied.empty()) {
    std::fprintf(stderr,
                 "sitedeck: status: permission denied: %zu file(s) under %s cannot be read "
                 "by this user (first: %s)\n",
                 report.denied.size(), report.data_dir.c_str(), report.denied[0].c_str());
    return kSdsToolReported;
  }
  return printed ? SDS_ERROR_NONE : kSdsToolReported;
}
