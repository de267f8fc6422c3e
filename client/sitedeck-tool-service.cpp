// The `sitedeck` subcommands about the service itself rather than one item:
// `hello`, `next-update`, `release` and `init` (a data pull, with a spinner
// on a terminal while it runs), and the argument and status helpers.
#include <json-glib/json-glib.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "sitedeck-client-commands.h"
#include "sitedeck-client-status.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-tool-output.h"
#include "sitedeck-tool.h"

namespace {

// What a pull's result means to the person who asked for it; the general
// meaning of a status says less about a pull than this.
const char* __pull_meaning(int status) {
  switch (status) {
    case SDS_ERROR_NONE:
      return "a new item list was stored";
    case SDS_ERROR_HTTP_NOT_MODIFIED:
      return "the stored item list is current";
    case SDS_ERROR_SERVER_REQUEST_FAILED:
      return "the server requests failed";
    case SDS_ERROR_HTTP_MOVED_PERMANENTLY:
      return "the server moved and could not be reached";
    case SDS_ERROR_DATA_PULL_FAILED:
      return "no pull possible (no server list or request URL)";
    default:
      return sds_client_status_meaning(status);
  }
}

// One-member documents of the simple commands.
bool __print_json_int(const char* name, long long value) {
  UniqueJsonBuilder json = sds_tool_json_builder();
  json_builder_begin_object(json.get());
  sds_tool_json_int(json.get(), name, value);
  json_builder_end_object(json.get());
  return sds_tool_json_print(json.get());
}

struct sds_tool_spinner {
  std::chrono::steady_clock::time_point start = std::chrono::steady_clock::now();
  unsigned frame = 0;
};

bool __spin(void* user) {
  static constexpr char kFrames[] = "|/-\\";
  auto* spinner = static_cast<sds_tool_spinner*>(user);
  double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - spinner->start).count();
  std::fprintf(stderr, "\r%c pulling the item list... %.1f s", kFrames[spinner->frame++ % 4],
               seconds);
  std::fflush(stderr);
  return true;
}

}  // namespace

bool sds_tool_parse_id(const char* text, int32_t* id) {
  if (text == nullptr || *text < '0' || *text > '9') return false;
  errno = 0;
  char* end = nullptr;
  long value = std::strtol(text, &end, 10);
  if (errno != 0 || *end != '\0' || value > INT32_MAX) return false;
  *id = static_cast<int32_t>(value);
  return true;
}

bool sds_tool_parse_double(const char* text, double* value) {
  if (text == nullptr || *text == '\0') return false;
  errno = 0;
  char* end = nullptr;
  double parsed = std::strtod(text, &end);
  if (errno != 0 || *end != '\0' || !std::isfinite(parsed)) return false;
  *value = parsed;
  return true;
}

void sds_tool_print_status(FILE* out, int status) {
  std::fprintf(out, "%d %s: %s", status, sds_client_status_name(status),
               sds_client_status_meaning(status));
}

void sds_tool_report_status(int status) {
  // The library gives 1 for a connection that broke as much as for a
  // service that sent it: both mean the connection is gone.
  if (status == SDS_ERROR_IO_ERROR) {
    std::fprintf(stderr, "sitedeck: lost the connection to the service: ");
  } else {
    std::fprintf(stderr, "sitedeck: the service answered ");
  }
  sds_tool_print_status(stderr, status);
  std::fprintf(stderr, "\n");
}

int sds_tool_hello(SdsConnection& connection, int argc, char** /*argv*/) {
  if (argc != 0) return kSdsToolUsage;
  if (sds_tool_output().json) {
    return __print_json_int("client_id", connection.cid()) ? SDS_ERROR_NONE : kSdsToolReported;
  }
  std::printf("client id: %d\n", connection.cid());
  return SDS_ERROR_NONE;
}

int sds_tool_next_update(SdsConnection& connection, int argc, char** /*argv*/) {
  if (argc != 0) return kSdsToolUsage;
  int32_t seconds = 0;
  int status = sds_client_get_next_update_duration(connection, &seconds);
  if (status != SDS_ERROR_NONE) return status;
  if (sds_tool_output().json) {
    return __print_json_int("seconds", seconds) ? SDS_ERROR_NONE : kSdsToolReported;
  }
  std::printf("%d\n", seconds);
  return SDS_ERROR_NONE;
}

int sds_tool_release(SdsConnection& connection, int argc, char** /*argv*/) {
  if (argc != 0) return kSdsToolUsage;
  int status = sds_client_release_shm(connection);
  if (status != SDS_ERROR_NONE) return status;
  if (sds_tool_output().json) {
    UniqueJsonBuilder json = sds_tool_json_builder();
    json_builder_begin_object(json.get());
    sds_tool_json_bool(json.get(), "released", true);
    json_builder_end_object(json.get());
    return sds_tool_json_print(json.get()) ? SDS_ERROR_NONE : kSdsToolReported;
  }
  std::printf("shared memory released\n");
  return SDS_ERROR_NONE;
}

bool sds_tool_no_arguments(int argc, char** argv, std::string* problem) {
  if (argc == 0) return true;
  *problem = std::string("unexpected argument ") + argv[0];
  return false;
}

// `init --lat LAT --lon LON [--version V]`, in any order. A position the
// service would not use (it would pull without one) is refused here, so a
// typing mistake is not mistaken for a pull for nowhere.
static bool __init_arguments(int argc, char** argv, double* latitude, double* longitude,
                             const char** version, std::string* problem) {
  bool have_latitude = false, have_longitude = false;
  *version = nullptr;
  for (int i = 0; i < argc; i += 2) {
    const bool is_lat = std::strcmp(argv[i], "--lat") == 0;
    const bool is_lon = std::strcmp(argv[i], "--lon") == 0;
    if (!is_lat && !is_lon && std::strcmp(argv[i], "--version") != 0) {
      *problem = std::string("unexpected argument ") + argv[i];
      return false;
    }
    if (i + 1 >= argc) {
      *problem = std::string(argv[i]) + (is_lat || is_lon ? " needs degrees" : " needs a value");
      return false;
    }
    const char* value = argv[i + 1];
    if (!is_lat && !is_lon) {
      *version = value;
      continue;
    }
    double* degrees = is_lat ? latitude : longitude;
    const double limit = is_lat ? 90 : 180;
    if (!sds_tool_parse_double(value, degrees)) {
      *problem = std::string(argv[i]) + " needs degrees (a number), not " + value;
      return false;
    }
    if (*degrees < -limit || *degrees > limit) {
      *problem = std::string(is_lat ? "latitude " : "longitude ") + value + " is outside " +
                 (is_lat ? "-90..90" : "-180..180");
      return false;
    }
    (is_lat ? have_latitude : have_longitude) = true;
  }
  if (!have_latitude || !have_longitude) {
    *problem = !have_latitude ? "--lat LAT is missing" : "--lon LON is missing";
    return false;
  }
  return true;
}

bool sds_tool_init_arguments(int argc, char** argv, std::string* problem) {
  double latitude = 0, longitude = 0;
  const char* version = nullptr;
  return __init_arguments(argc, argv, &latitude, &longitude, &version, problem);
}

int sds_tool_init(SdsConnection& connection, int argc, char** argv) {
  double latitude = 0, longitude = 0;
  const char* version = nullptr;
  std::string problem;
  if (!__init_arguments(argc, argv, &latitude, &longitude, &version, &problem)) {
    return kSdsToolUsage;
  }

  sds_tool_spinner spinner;
  bool animate = isatty(STDERR_FILENO) == 1;
  int status = sds_client_initialize(connection, latitude, longitude, version,
                                     animate ? __spin : nullptr, &spinner);
  if (animate) std::fprintf(stderr, "\r\033[K");
  // Status 1 is what a connection lost during the pull looks like, not a
  // result the service sent.
  if (status == SDS_ERROR_IO_ERROR || status == SDS_ERROR_IO_EINTR) return status;
  // Both outcomes leave a current deck behind.
  bool current = status == SDS_ERROR_NONE || status == SDS_ERROR_HTTP_NOT_MODIFIED;
  if (sds_tool_output().json) {
    UniqueJsonBuilder json = sds_tool_json_builder();
    json_builder_begin_object(json.get());
    sds_tool_json_int(json.get(), "status", status);
    sds_tool_json_text(json.get(), "name", sds_client_status_name(status));
    sds_tool_json_text(json.get(), "meaning", __pull_meaning(status));
    sds_tool_json_bool(json.get(), "deck_current", current);
    json_builder_end_object(json.get());
    if (!sds_tool_json_print(json.get())) return kSdsToolReported;
  } else {
    std::printf("pull result: %d %s: %s\n", status, sds_client_status_name(status),
                __pull_meaning(status));
  }
  if (current) return SDS_ERROR_NONE;
  if (sds_tool_output().json) {
    std::fprintf(stderr, "sitedeck: the pull failed: ");
    sds_tool_print_status(stderr, status);
    std::fprintf(stderr, "\n");
  }
  return kSdsToolReported;
}
