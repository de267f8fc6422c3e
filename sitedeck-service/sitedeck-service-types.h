// Types shared by every module of the service: the result codes that travel to
// the browser as statuses, the command numbers, the request header and the
// records that cross module boundaries. Plain data only; no behaviour lives here.
#pragma once

#include <pthread.h>

#include <cstddef>
#include <cstdint>

// The one result enumeration of the whole program (SDS_ERROR_*), whose
// numbers travel as statuses, is defined once for the service and its clients.
#include "sitedeck-client-status.h"

enum sds_cmd_e : int {
  SDS_CMD_INITIALIZE = 1,
  SDS_CMD_FREE_SHM = 2,
  SDS_CMD_GET_URL = 3,
  SDS_CMD_GET_TITLE = 4,
  SDS_CMD_GET_TOUCH_ICON_EXISTS = 5,
  SDS_CMD_GET_ICON_SIZE = 6,
  SDS_CMD_GET_ICON = 7,
  SDS_CMD_GET_FAVICON_EXISTS = 8,
  SDS_CMD_GET_DOMINANT_COLOR = 9,
  SDS_CMD_GET_NEXT_UPDATE_DURATION = 10,
  SDS_CMD_GET_FULL_IDS = 11,
};

// Column selector of command 11: the only condition a client can ask for.
constexpr uint16_t SITE_DECK_ADAPTOR_O_DIRTY = 1;

// Longest string item on the wire, in bytes, without terminator.
constexpr int SDS_IPC_STRING_MAX = 4096;
// Size of the shared-memory object that carries one icon's pixels.
constexpr size_t SDS_SHM_SIZE = 3145728;
// Next update duration the browser is told when nothing better is known.
constexpr int SDS_DEFAULT_UPDATE_SECONDS = 86400;

// The 12-byte request header; host byte order on the wire.
struct sds_command {
  int32_t cmd = 0;
  int32_t cid = 0;
  int32_t item_id = 0;
};
static_assert(sizeof(sds_command) == 12, "request header is 12 bytes on the wire");

// Arguments of one data pull (command 1). Texts are malloc'ed and owned.
struct sds_server_req_args {
  double latitude = 0;
  double longitude = 0;
  char* city = nullptr;
  char* province = nullptr;
  char* browser_version = nullptr;
};

// One touch icon of an item. `icon_path` is malloc'ed and owned.
struct sds_icon {
  int id = 0;
  char* icon_path = nullptr;
  char icon_size[12] = {};
  char last_modified[24] = {};
  int is_administered = 0;
  sds_icon* next = nullptr;
};

// One site of a downloaded item list. Texts and the icon list are owned.
struct sds_item {
  char* site_url = nullptr;
  char* site_name = nullptr;
  char* predominant_color = nullptr;
  int number_of_touch_icons = 0;
  int touch_icons_exists = 0;
  int fav_icon_exists = 0;
  int is_specially_removed = 0;
  sds_icon* ps_sds_icon_list = nullptr;
  sds_item* next = nullptr;
};

// One configured content server; `base_url` is malloc'ed and owned.
struct sds_server_data {
  char* base_url = nullptr;
  int id = 0;
  int wait_time = 0;
  int retry_count = 0;
  int fall_back = 0;
};

struct sds_server_list {
  sds_server_data* server = nullptr;
  sds_server_list* next = nullptr;
};

// The one client connection of a process.
struct sds_client {
  int client_id = 0;
  int sock = -1;
  pthread_t thread = 0;
  pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER;
};

// Per-process service state, owned by main.
struct sds_server_context {
  int listen_sock = -1;
  sds_client client;
};
