// The serving side of the default deck (the deck itself and its loader belong
// to the pull: pull/sitedeck-service-default-deck.h).
#pragma once

// Loads the default deck when the last database open created the table and a
// deck is installed; in the service binary this loads the pull module, and
// only then. Call right after the worker's first sds_ensure_db_open.
void sds_default_deck_load_if_created(void);
