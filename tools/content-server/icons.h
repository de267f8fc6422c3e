// Touch-icon PNGs for the content server, rendered with libpng from an icon's
// description: a background of the icon's colour with a centre square of the
// inverse colour (half the width and height), so a test can tell from the
// pixels whose icon it got. Alpha types give the background alpha 255 and the
// square alpha 128; grey types use the colour's luminance. Also the broken
// PNGs the fault controls serve.
#pragma once

#include <string>

#include "catalogue.h"

// Renders `icon` (its generation decides whether the colours are inverted).
// Returns false when libpng fails.
bool cs_render_icon_png(const cs_icon& icon, std::string* png);

// The colour the icon's background has in this generation; the square has its inverse.
cs_rgb cs_icon_background(const cs_icon& icon);

// Luminance used for grey icons: (299 R + 587 G + 114 B) / 1000.
int cs_luminance(cs_rgb c);

// A well-formed PNG header claiming 100000 x 100000 RGBA pixels, followed by a
// few bytes of image data and the end chunk.
std::string cs_huge_dimension_png();

// `png` cut off in the middle of its first image-data chunk.
std::string cs_truncate_png(const std::string& png);
