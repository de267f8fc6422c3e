// Command 1, initialize: the browser hands over the device's position and its
// version, and waits while a whole data pull runs on this thread; the pull's
// result is the final status.
#include <cmath>
#include <cstdlib>

#include "serve/sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-pull.h"
#include "serve/sitedeck-service-request-handler-internal.h"

namespace {

struct ReqArgsDeleter {
  void operator()(sds_server_req_args* args) const noexcept {
    std::free(args->browser_version);
    std::free(args->city);
    std::free(args->province);
    std::free(args);
  }
};
using UniqueReqArgs = std::unique_ptr<sds_server_req_args, ReqArgsDeleter>;

}  // namespace

int _initialize(int sock) {
  (void)sds_ipc_send_errorcode(sock, SDS_ERROR_NONE);

  double location[2] = {0, 0};
  if (sds_ipc_read_custom_type(sock, location, sizeof location) != 0) {
    SDS_LOGE("[CRITICAL] sds_ipc_read_custom_type failed");
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_IO_ERROR);
    return SDS_ERROR_IO_ERROR;
  }
  (void)sds_ipc_send_errorcode(sock, SDS_ERROR_NONE);

  UniqueCStr version;
  if (sds_ipc_read_errorcode(sock) == 0) version.reset(sds_ipc_read_string(sock));

  const double latitude = location[0];
  const double longitude = location[1];
  UniqueReqArgs args;
  // NaN fails every comparison, so it is refused like an out-of-range value.
  if (latitude >= -90 && latitude <= 90 && longitude >= -180 && longitude <= 180) {
    args.reset(static_cast<sds_server_req_args*>(std::calloc(1, sizeof(sds_server_req_args))));
    if (!args) {
      (void)sds_ipc_send_errorcode(sock, SDS_ERROR_OUT_OF_MEMORY);
      SDS_LOGE(" malloc for sds_server_req_args failed ");
      return SDS_ERROR_OUT_OF_MEMORY;
    }
    args->latitude = latitude;
    args->longitude = longitude;
    if (version && version.get()[0] != '\0') {
      args->browser_version = version.release();
    } else {
      SDS_LOGE("No Browser version info");
    }
  } else {
    SDS_LOGE("Invalid Location data: latitude = %lf longitude = %lf", latitude, longitude);
  }

  // Without the pull's code there is no pull to run.
  const sds_pull_calls* pull = sds_pull_get_calls();
  int result = pull != nullptr ? pull->check_data_pull_required(args.get())
                               : SDS_ERROR_DATA_PULL_FAILED;
  if (sds_ipc_send_errorcode(sock, result) != 0) {
    // The browser never learnt the outcome: make its next pull a full one.
    if (pull != nullptr) {
      (void)pull->remove_file(sds_path(SDS_ETAG_PATH).c_str());
      pull->set_next_update_duration(SDS_DEFAULT_UPDATE_SECONDS);
    }
    return SDS_ERROR_IO_ERROR;
  }
  return result;
}
