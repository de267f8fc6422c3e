// Handlers of the dispatcher that live in files of their own.
#pragma once

// Command 1: reads the position and browser version, runs a data pull and
// answers with its result. Returns an SDS code.
int _initialize(int sock);

struct sds_client;

// Commands 3, 4, 6 and 9: status, then the column's text.
int _sds_get_string(int sock, int item_id, const char* column);
// Commands 5 and 8: status, then the column's 32-bit value.
int _sds_get_int(int sock, int item_id, const char* column);
// Command 7: pixels into shared memory; status, byte count, width, height.
int _sds_get_blob(int sock, int item_id);
// Command 2: removes the shared-memory object; the connection ends after it.
int _sds_release_shm(sds_client* slot);
// Command 10: status, then the seconds until the next pull is due.
int _sds_get_next_update_duration(int sock);
// Command 11: reads the condition, answers status, count and the ids.
int _sds_get_full_ids(int sock);
