// The shared-memory object through which icon pixels reach the browser: made at
// each connection, mapped for the length of one icon request, removed only when
// the client asks. Results are 1 for success and 0 for failure.
#pragma once

int sds_alloc_shm(void);
int sds_free_shm(void);
// Returns a read-write shared mapping of the whole object, or null.
void* sds_attach_shm(void);
int sds_dettach_shm(void* address);
