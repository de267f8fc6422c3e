// Temporary stand-in until the item accessors land: the handle stays closed
// and opening it always succeeds.
#include "database/sitedeck-service-db-interface.h"

sqlite3* sds_db_handle = nullptr;

int sds_ensure_db_open(void) { return SDS_ERROR_NONE; }
