// The long help of each `sitedeck` subcommand, kept apart from the command
// table so that a row there stays one line. A subcommand without an entry
// here still gets its synopsis and one-line help.
#include <cstdio>
#include <cstring>

#include "sitedeck-tool.h"

namespace {

struct sds_tool_help {
  const char* name;
  const char* description;
  const char* options;
  const char* example;
  const char* exit_statuses;
};

constexpr char kServiceExits[] =
    "  0  success\n"
    "  1  the service answered a non-zero status, could not be reached, or the\n"
    "     output could not be written\n"
    "  2  bad usage\n";

constexpr sds_tool_help kHelp[] = {
    {"hello",
     "Connects to the service, prints the client id its greeting issued and\n"
     "disconnects. A quick check that the socket unit and the service work.\n",
     "", "sitedeck hello", kServiceExits},
    {"list",
     "Prints the live items in the order the browser shows them: id, title,\n"
     "URL, dominant colour, icon size and the touch-icon and favicon flags.\n"
     "On a terminal long titles and URLs are cut to fit its width.\n",
     "", "sitedeck list\n  sitedeck --json list | jq '.items[].url'", kServiceExits},
    {"show",
     "Prints every field the service stores for item ID, and the size of its\n"
     "icon pixels. A field with nothing stored shows as (none).\n",
     "  ID  the item's id, as `list` shows it\n", "sitedeck show 7", kServiceExits},
    {"icon",
     "Fetches the icon pixels of item ID through the shared-memory object and\n"
     "writes them to FILE as a PNG image.\n",
     "  ID       the item's id\n"
     "  -o FILE  where to write the PNG (overwritten)\n",
     "sitedeck icon 7 -o news.png",
     "  0  success\n"
     "  1  the service answered a non-zero status (6: the item has no icon),\n"
     "     could not be reached, or FILE could not be written\n"
     "  2  bad usage\n"},
    {"next-update",
     "Prints the seconds after which the browser should ask for a new pull\n"
     "(86400 when the content server gave no max-age).\n",
     "", "sitedeck next-update", kServiceExits},
    {"release",
     "Removes the service's shared-memory object for icon pixels, as the\n"
     "browser does when it is done with icons. The service then ends the\n"
     "connection.\n",
     "", "sitedeck release",
     "  0  the object was removed\n"
     "  1  the service answered a non-zero status (2: the object was already\n"
     "     gone), could not be reached, or the output could not be written\n"
     "  2  bad usage\n"},
    {"init",
     "Hands the service a position and a browser version and runs a data pull\n"
     "from the content servers, waiting for its result (this can take minutes;\n"
     "on a terminal a spinner shows it runs). The result is printed by number,\n"
     "name and meaning.\n",
     "  --lat LAT    latitude in degrees, -90 to 90\n"
     "  --lon LON    longitude in degrees, -180 to 180\n"
     "  --version V  the browser version sent to the content server\n",
     "sitedeck init --lat 37.5665 --lon 126.978 --version 2.0",
     "  0  a new item list was stored (status 0), or the server found the stored\n"
     "     one current (status 17, not modified): either way the deck is current\n"
     "  1  the pull failed (the status says why) or the service was unreachable\n"
     "  2  bad usage, or a position outside -90..90 / -180..180 degrees\n"},
    {"render",
     "Writes the start page the browser would show: the live items in the\n"
     "server's order as tiles with their icon, title and dominant colour, in\n"
     "one self-contained HTML file, OUT_DIR/index.html (OUT_DIR is created when\n"
     "missing; the page is written whole or not at all). Sites the server\n"
     "withdrew are left out; an item without an icon gets its first letter.\n"
     "The header says where the deck came from (the installed default deck, or\n"
     "a pull for which region and when) and how many withdrawn sites it leaves\n"
     "out; each tile shows its site's host under its title.\n"
     "Prints the page's path.\n",
     "  OUT_DIR  the directory for index.html\n",
     "sitedeck render /tmp/deck && chromium /tmp/deck/index.html",
     "  0  the page was written\n"
     "  1  the service answered a non-zero status, could not be reached, or\n"
     "     the page could not be written\n"
     "  2  bad usage\n"},
    {"status",
     "Shows what the service has stored, from the files under its data\n"
     "directory only, so it works while the service is stopped, and changes\n"
     "nothing: the configured servers, the stored ETag, the next update\n"
     "duration, when the last pull ended and how, when the next is due, the\n"
     "last resolved position with its city and province, the number of live\n"
     "and withdrawn items and the age of the database. A missing file is shown\n"
     "as \"none\", one this user may not read as \"permission denied\".\n",
     "", "sitedeck status\n  SITEDECK_ROOT=/tmp/scratch sitedeck --json status",
     "  0  the data directory exists (whatever is missing inside it)\n"
     "  1  there is no data directory, a file in it may not be read by this\n"
     "     user, or the output could not be written\n"
     "  2  bad usage\n"},
};

}  // namespace

void sds_tool_print_command_help(FILE* out, const sds_tool_command& command) {
  std::fprintf(out, "usage: sitedeck [OPTIONS] %s%s%s\n\n", command.name,
               command.arguments[0] != '\0' ? " " : "", command.arguments);
  const sds_tool_help* help = nullptr;
  for (const auto& entry : kHelp) {
    if (std::strcmp(entry.name, command.name) == 0) help = &entry;
  }
  if (help == nullptr) {
    std::fprintf(out, "%s.\n", command.help);
    return;
  }
  std::fprintf(out, "%s", help->description);
  if (help->options[0] != '\0') std::fprintf(out, "\narguments:\n%s", help->options);
  std::fprintf(out,
               "\nglobal options (before or after the command): --json, --color=WHEN;\n"
               "before it: --socket PATH, --timeout MS, --verbose (see sitedeck --help)\n");
  std::fprintf(out, "\nexample:\n  %s\n", help->example);
  std::fprintf(out, "\nexit status:\n%s", help->exit_statuses);
}
