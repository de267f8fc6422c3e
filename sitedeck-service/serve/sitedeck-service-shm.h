// The shared-memory object through which icon pixels reach the browser: made at
// each connection, mapped once for the icon requests of the connection,
// removed only when the client asks. Results are 1 for success and 0 for
// failure.
#pragma once

int sds_alloc_shm(void);
int sds_free_shm(void);
// Returns a read-write shared mapping of the whole object, or null.
void* sds_attach_shm(void);
int sds_dettach_shm(void* address);

// The mapping the icon requests of this process share: made on first use and
// kept while the object's name still leads to the object mapped; when it
// leads elsewhere (the object was removed or made anew) the object behind the
// name is mapped now, as sds_attach_shm would, with its log lines on failure.
// Returns the mapping (not to be unmapped by the caller) or null. Worker only.
void* sds_shm_kept_mapping(void);
// Unmaps the kept mapping, after the object was removed.
void sds_shm_drop_kept_mapping(void);

// Command 7 copies into the kept mapping between these two calls. Should
// another process cut the object short meanwhile, the copy goes on into
// private memory instead of dying of SIGBUS; the end then returns false (the
// object holds no whole icon) and the kept mapping is let go. Worker only.
void sds_shm_copy_begin(void);
[[nodiscard]] bool sds_shm_copy_end(void);
