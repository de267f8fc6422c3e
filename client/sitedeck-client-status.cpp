// Names and meanings of the statuses and the client library's own codes in
// one table, so that every program built on the library explains a status
// the same way.
#include "sitedeck-client-status.h"

namespace {

struct sds_status_text {
  int status;
  const char* name;
  const char* meaning;
};

constexpr sds_status_text kStatusTexts[] = {
    {SDS_ERROR_NONE, "SDS_ERROR_NONE", "success"},
    {SDS_ERROR_IO_ERROR, "SDS_ERROR_IO_ERROR",
     "a socket read or write failed or the connection was closed"},
    {SDS_ERROR_SHM_FAILED, "SDS_ERROR_SHM_FAILED",
     "the shared-memory object for icon pixels could not be created, mapped or removed"},
    {SDS_ERROR_IO_EAGAIN, "SDS_ERROR_IO_EAGAIN", "a socket operation would have blocked"},
    {SDS_ERROR_IO_EINTR, "SDS_ERROR_IO_EINTR", "a socket operation was interrupted"},
    {SDS_ERROR_INVALID_PARAMETER, "SDS_ERROR_INVALID_PARAMETER",
     "the request had a bad argument or could not be used"},
    {SDS_ERROR_NO_DATA, "SDS_ERROR_NO_DATA", "nothing is stored for this request"},
    {SDS_ERROR_OUT_OF_MEMORY, "SDS_ERROR_OUT_OF_MEMORY", "the service ran out of memory"},
    {SDS_ERROR_ID_NOT_FOUND, "SDS_ERROR_ID_NOT_FOUND", "no item has this id"},
    {SDS_ERROR_DISK_BUSY, "SDS_ERROR_DISK_BUSY",
     "the database is busy or locked, a value is too big, or there is no connection to it"},
    {SDS_ERROR_NO_SPACE, "SDS_ERROR_NO_SPACE", "the database is full"},
    {SDS_ERROR_DB_OPEN_FAILED, "SDS_ERROR_DB_OPEN_FAILED", "the database could not be opened"},
    {SDS_ERROR_HTTP_OK, "SDS_ERROR_HTTP_OK", "the content server answered HTTP 200"},
    {SDS_ERROR_HTTP_NOT_MODIFIED, "SDS_ERROR_HTTP_NOT_MODIFIED",
     "the content server answered HTTP 304: the stored item list is current"},
    {SDS_ERROR_SERVER_REQUEST_FAILED, "SDS_ERROR_SERVER_REQUEST_FAILED",
     "a server request failed or got an unexpected answer"},
    {SDS_ERROR_HTTP_MOVED_PERMANENTLY, "SDS_ERROR_HTTP_MOVED_PERMANENTLY",
     "the content server answered HTTP 301 (moved permanently)"},
    {SDS_ERROR_HTTP_FOUND, "SDS_ERROR_HTTP_FOUND",
     "the content server answered HTTP 302 (found elsewhere)"},
    {SDS_ERROR_DATA_PULL_FAILED, "SDS_ERROR_DATA_PULL_FAILED",
     "the data pull could not run (no server list, request URL or response header file)"},
    {SDS_CLIENT_ERROR_NO_SOCKET, "SDS_CLIENT_ERROR_NO_SOCKET", "there is no socket file"},
    {SDS_CLIENT_ERROR_NOT_LISTENING, "SDS_CLIENT_ERROR_NOT_LISTENING",
     "nobody is listening on the socket"},
    {SDS_CLIENT_ERROR_PERMISSION_DENIED, "SDS_CLIENT_ERROR_PERMISSION_DENIED",
     "permission to use the socket was denied"},
    {SDS_CLIENT_ERROR_BUSY, "SDS_CLIENT_ERROR_BUSY",
     "the service is busy with another connection"},
    {SDS_CLIENT_ERROR_TIMED_OUT, "SDS_CLIENT_ERROR_TIMED_OUT",
     "connecting to the service timed out"},
    {SDS_CLIENT_ERROR_CLOSED_BEFORE_GREETING, "SDS_CLIENT_ERROR_CLOSED_BEFORE_GREETING",
     "the service closed the connection before its greeting"},
    {SDS_CLIENT_ERROR_CONNECT_FAILED, "SDS_CLIENT_ERROR_CONNECT_FAILED",
     "the socket could not be connected"},
};

const sds_status_text* __sds_find_status_text(int status) {
  for (const auto& text : kStatusTexts) {
    if (text.status == status) return &text;
  }
  return nullptr;
}

}  // namespace

const char* sds_client_status_name(int status) {
  const sds_status_text* text = __sds_find_status_text(status);
  return text != nullptr ? text->name : "SDS_ERROR_UNKNOWN";
}

const char* sds_client_status_meaning(int status) {
  const sds_status_text* text = __sds_find_status_text(status);
  return text != nullptr ? text->meaning : "a status number the service does not use";
}
