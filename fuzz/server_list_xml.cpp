// Fuzz target: the server list file through its reader and through the
// rewrite of one base URL (done on a copy, as after a permanent redirect).
// A list that could be read must still be read, with as many servers, after
// the rewrite.
#include <cstdint>
#include <cstdlib>

#include "fuzz_support.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"

namespace {

constexpr size_t kMaxInput = 64 * 1024;
// Characters that must be escaped on the way into the file.
constexpr const char* kNewBaseUrl = "http://moved.example/a?b=1&c=<2>&d='\"'/SiteDeck/x";

struct ServerList {
  sds_server_list* head = nullptr;
  ~ServerList() { sds_free_server_list(&head); }
};

int count_of(const sds_server_list* head) {
  int n = 0;
  for (; head != nullptr; head = head->next) ++n;
  return n;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return -1;
  const std::string path = fuzz_path(SDS_SERVER_DATA_XML);
  const std::string copy = fuzz_path(SDS_SERVER_DIR "/server-list-copy.xml");
  fuzz_write_file(path, data, size);
  fuzz_write_file(copy, data, size);

  ServerList list;
  list.head = sds_get_server_data(path.c_str());
  print_server_data(list.head);
  if (list.head == nullptr) {
    // Unreadable, or a list without servers: nothing to check but survival.
    (void)sds_update_base_url(copy.c_str(), 1, kNewBaseUrl);
    return 0;
  }
  const int id = list.head->server->id;
  if (sds_update_base_url(copy.c_str(), id, kNewBaseUrl) != 0) std::abort();
  ServerList rewritten;
  rewritten.head = sds_get_server_data(copy.c_str());
  if (rewritten.head == nullptr || count_of(rewritten.head) != count_of(list.head)) std::abort();
  return 0;
}
