#include "support/pull_env.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "kdb.h"
#include "serve/sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/temp_root.h"

// The server list document for `servers`, in order.
static std::string server_list_xml(const std::vector<ServerEntry>& servers) {
  std::string xml = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<values>\n";
  for (const ServerEntry& s : servers) {
    xml += "  <Server>\n    <Id>" + std::to_string(s.id) + "</Id>\n    <Base-url>" + s.base_url +
           "</Base-url>\n    <WaitTime>" + std::to_string(s.wait_time) +
           "</WaitTime>\n    <RetryCount>" + std::to_string(s.retry_count) +
           "</RetryCount>\n    <FallBack>" + (s.fall_back ? "true" : "false") +
           "</FallBack>\n  </Server>\n";
  }
  return xml + "</values>\n";
}

bool write_server_list(const std::vector<ServerEntry>& servers) {
  return write_file(sds_path(SDS_SERVER_DATA_XML), server_list_xml(servers));
}

void set_stall_seconds(int seconds) {
  (void)kdb_write("db/browser/sitedeck/transfer_stall_seconds", std::to_string(seconds).c_str());
}

std::string root_file_or_none(const char* fixed_path) {
  std::string path = sds_path(fixed_path);
  return file_exists(path) ? read_file(path) : "<none>";
}

namespace {


bool send_int(int fd, int32_t value) {
  return sds_ipc_send_custom_type(fd, &value, sizeof value) == 0;
}

// Sends command 1; reads the two intermediate statuses into `reply` if given.
bool exchange_initialize(int fd, int cid, double latitude, double longitude, int flag,
                         const std::string* version, InitializeReply* reply) {
  sds_command header{SDS_CMD_INITIALIZE, cid, 0};
  if (sds_ipc_send_command(fd, &header) != 0) return false;
  if (reply != nullptr) reply->ready = sds_ipc_read_errorcode(fd);
  double position[2] = {latitude, longitude};
  if (sds_ipc_send_custom_type(fd, position, sizeof position) != 0) return false;
  if (reply != nullptr) reply->received = sds_ipc_read_errorcode(fd);
  if (!send_int(fd, flag)) return false;
  if (flag == 0 && version != nullptr) {
    if (version->empty()) return send_int(fd, 0);
    return sds_ipc_send_string(fd, version->c_str()) == 0;
  }
  return true;
}

}  // namespace

std::string first_pixel_hex(const std::string& url) {
  return DbSession::rows(
      "SELECT CASE WHEN icon_data IS NULL THEN 'NULL' ELSE hex(substr(icon_data, 1, 4)) END "
      "FROM site_deck WHERE url = '" + url + "'");
}

std::string bgra_hex(const char* rgb, const char* alpha) {
  std::string hex = rgb[0] == '#' ? rgb + 1 : rgb;
  return hex.substr(4, 2) + hex.substr(2, 2) + hex.substr(0, 2) + alpha;
}

bool send_initialize(int fd, int cid, double latitude, double longitude, int flag,
                     const std::string* version) {
  return exchange_initialize(fd, cid, latitude, longitude, flag, version, nullptr);
}

InitializeReply run_initialize(int fd, int cid, double latitude, double longitude, int flag,
                               const std::string* version) {
  InitializeReply reply;
  if (exchange_initialize(fd, cid, latitude, longitude, flag, version, &reply)) {
    reply.final = sds_ipc_read_errorcode(fd);
  }
  return reply;
}
