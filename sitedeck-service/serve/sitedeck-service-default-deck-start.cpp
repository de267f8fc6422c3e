// The serving side of the default deck: after the worker's first database
// open, and only when that open created the table and a deck is installed,
// it reaches the deck loader through the pull's entry points. So a process
// that only reads an existing deck never loads the pull module for it.
#include <unistd.h>

#include <string>

#include "database/sitedeck-service-db.h"
#include "serve/sitedeck-service-default-deck-start.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-pull.h"

void sds_default_deck_load_if_created(void) {
  if (!sds_db_take_created_table()) return;
  const std::string list_path = sds_path(SDS_DEFAULT_DECK_JSON_PATH);
  if (access(list_path.c_str(), F_OK) != 0) return;
  const sds_pull_calls* calls = sds_pull_get_calls();
  if (calls == nullptr || calls->load_default_deck == nullptr) {
    SDS_LOGE("default deck not loaded: the pull module is unavailable");
    return;
  }
  (void)calls->load_default_deck();
}
