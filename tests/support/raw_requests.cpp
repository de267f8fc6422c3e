#include "support/raw_requests.h"

#include <cstdlib>

#include "sitedeck-service-ipc.h"
#include "sitedeck-service-raii.h"

namespace {

bool read_exact(int fd, void* buffer, size_t length) {
  return sds_ipc_read_blob(fd, buffer, length) == 0;
}

bool send_int(int fd, int32_t value) { return sds_ipc_send_custom_type(fd, &value, 4) == 0; }

}  // namespace

int request_ids(const SdsConnection& connection, std::vector<int32_t>* ids,
                bool default_condition) {
  const int fd = connection.fd();
  if (sds_client_send_header(connection, SDS_CMD_GET_FULL_IDS, 0) != SDS_ERROR_NONE) {
    return SDS_ERROR_IO_ERROR;
  }
  if (default_condition) {
    if (!send_int(fd, SDS_ERROR_NO_DATA)) return SDS_ERROR_IO_ERROR;
  } else {
    const uint16_t selector = SITE_DECK_ADAPTOR_O_DIRTY;
    if (!send_int(fd, SDS_ERROR_NONE) || sds_ipc_send_custom_type(fd, &selector, 2) != 0 ||
        !send_int(fd, 1)) {
      return SDS_ERROR_IO_ERROR;
    }
  }
  int status = sds_client_read_status(connection);
  if (status != SDS_ERROR_NONE) return status;
  int32_t count = 0;
  if (!read_exact(fd, &count, sizeof count) || count < 0) return SDS_ERROR_IO_ERROR;
  std::vector<int32_t> result(static_cast<size_t>(count));
  if (count > 0 && !read_exact(fd, result.data(), result.size() * sizeof(int32_t))) {
    return SDS_ERROR_IO_ERROR;
  }
  *ids = std::move(result);
  return SDS_ERROR_NONE;
}

int request_text(const SdsConnection& connection, int32_t cmd, int32_t id, std::string* text) {
  int status = sds_client_request(connection, cmd, id);
  if (status != SDS_ERROR_NONE) return status;
  UniqueCStr value(sds_ipc_read_string(connection.fd()));
  if (!value) return SDS_ERROR_IO_ERROR;
  *text = value.get();
  return SDS_ERROR_NONE;
}

int request_int(const SdsConnection& connection, int32_t cmd, int32_t id, int32_t* value) {
  int status = sds_client_request(connection, cmd, id);
  if (status != SDS_ERROR_NONE) return status;
  return read_exact(connection.fd(), value, sizeof *value) ? SDS_ERROR_NONE : SDS_ERROR_IO_ERROR;
}

int request_icon(const SdsConnection& connection, int32_t id, int32_t* bytes, int32_t* width,
                 int32_t* height) {
  int status = sds_client_request(connection, SDS_CMD_GET_ICON, id);
  if (status != SDS_ERROR_NONE) return status;
  int32_t reply[3] = {0, 0, 0};
  if (!read_exact(connection.fd(), reply, sizeof reply)) return SDS_ERROR_IO_ERROR;
  *bytes = reply[0];
  *width = reply[1];
  *height = reply[2];
  return SDS_ERROR_NONE;
}

int request_next_update(const SdsConnection& connection, int32_t* seconds) {
  return request_int(connection, SDS_CMD_GET_NEXT_UPDATE_DURATION, 0, seconds);
}

int request_free_shm(const SdsConnection& connection) {
  return sds_client_request(connection, SDS_CMD_FREE_SHM, 0);
}

std::vector<std::string> live_items(const SdsConnection& connection, int* status) {
  int ignored = 0;
  if (status == nullptr) status = &ignored;
  std::vector<int32_t> ids;
  *status = request_ids(connection, &ids);
  if (*status != SDS_ERROR_NONE) return {};
  std::vector<std::string> items;
  for (int32_t id : ids) {
    std::string url;
    *status = request_text(connection, SDS_CMD_GET_URL, id, &url);
    if (*status != SDS_ERROR_NONE) return {};
    items.push_back(std::to_string(id) + "|" + url);
  }
  return items;
}
