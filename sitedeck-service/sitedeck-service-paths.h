// Fixed file-system locations of the service. Every absolute path goes through
// sds_path(), which puts $SITEDECK_ROOT (when set and not empty) in front, so
// that tests and the demo run in a scratch directory instead of /opt.
#pragma once

#include <string>

#define SDS_SOCKET_PATH "/opt/data/browser-sitedeck-service/browser-sitedeck-service.sock"
#define SDS_DATA_DIR "/opt/usr/data/browser-sitedeck-service"
#define SDS_SERVER_DIR SDS_DATA_DIR "/server"
#define SDS_DATABASE_DIR SDS_DATA_DIR "/database"
#define SDS_IMAGES_DIR SDS_DATA_DIR "/images"
#define SDS_DB_PATH SDS_DATABASE_DIR "/.site-deck.db"
#define SDS_SERVER_DATA_XML SDS_SERVER_DIR "/site_deck_server_data.xml"
#define SDS_JSON_RESPONSE_PATH SDS_SERVER_DIR "/site_deck_server_json_response"
#define SDS_HEADER_RESPONSE_PATH SDS_SERVER_DIR "/site_deck_server_header_response"
#define SDS_ETAG_PATH SDS_SERVER_DIR "/site_deck_server_etag"
#define SDS_ETAG_TO_UPDATE_PATH SDS_SERVER_DIR "/site_deck_server_etag_to_update"
#define SDS_NEXT_UPDATE_DURATION_PATH SDS_SERVER_DIR "/next_update_duration"
#define SDS_HERE_XML_PATH SDS_SERVER_DIR "/site_deck_here_xml.xml"
#define SDS_LOCATION_INFO_PATH SDS_SERVER_DIR "/location_info.xml"
// When the last pull ran and how it ended (docs/storage.md).
#define SDS_LAST_PULL_PATH SDS_SERVER_DIR "/last_pull"
// The deck installed with the service for a first start: an item list in the
// content server's format and the icon files it names.
#define SDS_DEFAULT_DECK_DIR SDS_DATA_DIR "/default-deck"
#define SDS_DEFAULT_DECK_JSON_PATH SDS_DEFAULT_DECK_DIR "/site_deck_default.json"

// The shared-memory object's name is global to the machine, never prefixed.
#define SDS_SHM_NAME "/browser_sds_shm_file"
#define SDS_SHM_FILE_PATH "/dev/shm/browser_sds_shm_file"
#define SDS_SHM_LABEL "browser-sitedeck-service::shm"

// Returns `fixed_path` below the root named by $SITEDECK_ROOT, or unchanged
// when that variable is unset or empty. Read on every call so that a test can
// move the root between cases.
std::string sds_path(const char* fixed_path);
