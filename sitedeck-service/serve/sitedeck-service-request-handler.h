// The request dispatcher: runs the handler of one command for the connection
// and writes its reply. Command 1 runs a whole data pull before it answers.
#pragma once

#include "sitedeck-service-types.h"

// Returns the handler's SDS code (0 for command 1 and for unknown commands).
int sds_handle_requests(sds_client* slot, const sds_command* command);
