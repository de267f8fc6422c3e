// Words for the statuses the service sends, for programs that show them to a
// person: the constant's own name (sds_error_string keeps "SDS_ERROR_UNKNOWN"
// for several codes because peers compare that text) and a one-line meaning.
#pragma once

// "SDS_ERROR_SHM_FAILED" for 2 and so on; "SDS_ERROR_UNKNOWN" for a number
// the protocol does not use. Constant text, never null.
const char* sds_client_status_name(int status);

// What `status` means, as one lower-case line without a full stop; for an
// unused number, that the service never sends it. Constant text, never null.
const char* sds_client_status_meaning(int status);
