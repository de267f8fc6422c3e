// Placeholder until the wire protocol lands.
#include "sitedeck-service-ipc.h"

int sds_ipc_recv(int, void*, size_t, const char*) { return -1; }
int sds_ipc_check_stderr(int default_code) { return default_code; }
int sds_ipc_read_errorcode(int) { return SDS_ERROR_IO_ERROR; }
int sds_ipc_send_errorcode(int, int) { return -1; }
int sds_ipc_send_command(int, const sds_command*) { return -1; }
int sds_ipc_read_int(int, int*) { return -1; }
int sds_ipc_read_custom_type(int, void*, size_t) { return -1; }
char* sds_ipc_read_string(int) { return nullptr; }
int sds_ipc_send_string(int, const char*) { return -1; }
int sds_ipc_simple_response(int, const sds_command*) { return SDS_ERROR_IO_ERROR; }
int sds_ipc_send_custom_type(int, const void*, size_t) { return -1; }
int sds_ipc_read_blob(int, void*, size_t) { return -1; }
