// XML files of the service: the server list (read, logged, one base URL
// rewritten) and the geocoder's answer and stored location of the location
// step. XML from disk and network is parsed without network access, entity
// loading or DTDs, and with a size cap.
#pragma once

#include "sitedeck-service-types.h"

typedef struct _xmlNode xmlNode;
typedef struct _xmlDoc xmlDoc;

// Returns a new list in file order, or null; release with sds_free_server_list.
sds_server_list* sds_get_server_data(const char* path);
void print_server_data(const sds_server_list* head);
// Rewrites the Base-url of server `id`; 0 when the file was processed.
int sds_update_base_url(const char* path, int id, const char* new_base_url);

// Location: parse the saved geocoder answer into args->city / args->province.
int sds_parse_city_and_province(sds_server_req_args* args);
void __get_city_and_province_from_xml(xmlNode* node, xmlDoc* doc, sds_server_req_args* args);
// Fills city and province from the stored location when the position matches.
int get_city_and_province_from_stored(sds_server_req_args* args);
void save_city_and_province(const sds_server_req_args* args);
