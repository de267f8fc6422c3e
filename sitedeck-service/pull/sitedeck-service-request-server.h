// Server synchronisation: the data-pull job with its retries, redirects and
// fall-back servers; one item-list download with its caching headers; the
// item-list records and their parsing; the transfer settings shared by every
// HTTP transfer; the signed request URL; and the network half of the location
// step. Everything here runs on the one thread that carries out a pull.
#pragma once

#include <cstddef>

#include "sitedeck-service-types.h"

// --- Item list records -----------------------------------------------------
extern sds_item* sds_item_list_head;
extern sds_item* sds_item_list_tail;
// Result code of the current pull step.
extern int sds_last_error;
// Base URL named by the last 301/302 answer, owned; null when none.
extern char* sds_redirect_base_url;
// Set when a download stored a whole list (merge committed, ETag taken over);
// the pull job clears it before its first attempt.
extern bool sds_pull_stored_list;

// Appends a zero-filled item to the global list; null (and sds_last_error 7)
// when it cannot be allocated.
sds_item* sds_allocate_item_memory(void);
// Appends a zero-filled icon to `*list`; null when it cannot be allocated.
sds_icon* sds_allocate_icon_memory(sds_icon** list);
void sds_free_icon_list(sds_icon** list);
void sds_free_item_list(void);
// Removes from the global list the items the deck must not hold: no site URL,
// a URL that is not an http or https address, or a URL longer than a string
// item carries (SDS_IPC_STRING_MAX); a title or colour that long is dropped
// from its item. Each refusal is logged. Returns the number of items left.
int sds_drop_unusable_items(void);
// True when the deck may hold `item` (sds_drop_unusable_items keeps it).
bool sds_item_is_usable(const sds_item* item);

// --- Item-list parsing -----------------------------------------------------
// Builds the global item list from a saved JSON answer. An answer that is no
// JSON item list, or that passes a bound (file size, nesting, items, icons of
// an item), is refused whole: no list is left, sds_last_error becomes
// SDS_ERROR_SERVER_REQUEST_FAILED and sds_item_list_refusal says why.
void sds_parse_json_data(const char* path);
// Why the last parse refused its answer (a constant text); null when it did not.
extern const char* sds_item_list_refusal;

// --- Transfer settings -----------------------------------------------------
char* sds_get_proxy_address(void);
char* sds_get_user_agent_string(void);
void sds_set_next_update_duration(int seconds);

// Applies the proxy rule and the fixed settings to a libcurl easy handle
// (passed as void* so that this header does not need curl.h). `*user_agent`
// and `*proxy` receive the texts the handle now points at; the caller frees
// them after the transfer. Returns SDS_ERROR_NONE or SDS_ERROR_OUT_OF_MEMORY.
int sds_transfer_apply_settings(void* curl, char** user_agent, char** proxy);

// --- Request URL -----------------------------------------------------------
char* sds_get_country_iso(void);
const char* sds_get_operator_code(void);
// Returns the malloc'ed signed request URL for `server`, or null.
char* sds_get_request_url(const sds_server_data* server, const sds_server_req_args* args);

// --- Item-list download ----------------------------------------------------
int sds_download_and_parse_json_data(const char* url);
// Reads the saved header lines of an answer with `http_status`. A relative
// Location is resolved against the URL the current download asked for.
void sds_parse_header(const char* path, long http_status);

// How the last item-list download ended, for the line the pull logs when an
// attempt fails: the HTTP status (0 when none came), libcurl's own words for a
// transfer that did not complete or why a received answer was refused, and
// how long the transfer took.
struct sds_transfer_outcome {
  long http_status = 0;
  char reason[256] = {};
  double seconds = 0;
};
extern sds_transfer_outcome sds_last_transfer;

// --- Data-pull job ---------------------------------------------------------
int sds_check_data_pull_required(sds_server_req_args* args);
void sds_free_server_list(sds_server_list** head);

// --- Location (network half) -------------------------------------------------
int sds_get_city_and_province(sds_server_req_args* args);
char* __get_here_reverse_geocoder_url(double latitude, double longitude);
char* get_string_from_location(double latitude, double longitude);
size_t sds_parse_here_xml_header(char* line, size_t size, size_t count, void* user);
size_t sds_download_xml_data(char* chunk, size_t size, size_t count, void* user);
