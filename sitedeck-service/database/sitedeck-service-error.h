// Names of the SDS result codes, for log lines: the design's own table, which
// peers compare, so codes without a name of their own stay "SDS_ERROR_UNKNOWN".
#pragma once

// The constant name of an SDS code; "SDS_ERROR_UNKNOWN" for codes without one.
const char* sds_error_string(int code);
