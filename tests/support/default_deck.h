// Builds default decks for tests: the item list in the content server's JSON
// format and real PNG icons, written into the default-deck directory of the
// root named by $SITEDECK_ROOT.
#pragma once

#include <string>
#include <vector>

#include "support/png_maker.h"

struct DeckSite {
  std::string url;
  std::string name;
  std::string color;
  std::string icon;  // file name below the icon URL's directory; "" lists no icon
  PngImage image;    // written as `icon` unless `write_icon` is false
  bool write_icon = true;
  bool specially_removed = false;
};

// Creates the default-deck directory with `json` as its list (nothing else).
bool write_deck_list(const std::string& json);
// Creates the directory with the item list for `sites` (the chosen,
// administered icon of each, plus a larger other one whose file is never
// written, so that a wrong icon choice shows as a missing icon) and every
// icon file.
bool write_deck(const std::vector<DeckSite>& sites);
// Three small sites with distinct images (RGBA, RGB and palette).
std::vector<DeckSite> small_deck();
