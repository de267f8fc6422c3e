// Names of the SDS result codes, for log lines and for the client tool.
#include "database/sitedeck-service-error.h"

#include "sitedeck-service-types.h"

const char* sds_error_string(int code) {
  switch (code) {
    case SDS_ERROR_NONE:
      return "SDS_ERROR_NONE";
    case SDS_ERROR_IO_ERROR:
      return "SDS_ERROR_IO_ERROR";
    case SDS_ERROR_IO_EAGAIN:
      return "SDS_ERROR_IO_EAGAIN";
    case SDS_ERROR_IO_EINTR:
      return "SDS_ERROR_IO_EINTR";
    case SDS_ERROR_INVALID_PARAMETER:
      return "SDS_ERROR_INVALID_PARAMETER";
    case SDS_ERROR_NO_DATA:
      return "SDS_ERROR_NO_DATA";
    case SDS_ERROR_OUT_OF_MEMORY:
      return "SDS_ERROR_OUT_OF_MEMORY";
    case SDS_ERROR_ID_NOT_FOUND:
      return "SDS_ERROR_ID_NOT_FOUND";
    case SDS_ERROR_DISK_BUSY:
      return "SDS_ERROR_DISK_BUSY";
    case SDS_ERROR_NO_SPACE:
      return "SDS_ERROR_NO_SPACE";
    case SDS_ERROR_SERVER_REQUEST_FAILED:
      return "SDS_ERROR_SERVER_REQUEST_FAILED";
    default:
      // Codes 2, 15, 16, 17, 19, 20 and 21 have no name of their own on
      // purpose: peers compare these texts, so they must not change.
      return "SDS_ERROR_UNKNOWN";
  }
}
