// deck-icons: a small program built against the installed client library,
// the way a browser would use it. It lists the live sites of the deck (id,
// title and URL, tab-separated, in the server's order) and saves the icon of
// each site that has one as OUT_DIR/ID.png, through libpng's simplified API.
//
//   usage: deck-icons OUT_DIR [SOCKET]
//
// Build it with pkg-config:
//   c++ -std=c++17 deck-icons.cpp $(pkg-config --cflags --libs sitedeck-client libpng)
// or with CMake, from the CMakeLists.txt beside it (find_package(SitedeckClient)).
#include <png.h>
#include <sitedeck-client-deck.h>

#include <cstdio>
#include <cstring>
#include <string>

namespace {

// Prints why a call failed: the status, and the system's reason if any.
int fail(const char* what, int status, const SdsConnection& connection) {
  std::fprintf(stderr, "deck-icons: %s: %s (%s)", what, sds_client_status_meaning(status),
               sds_client_status_name(status));
  if (connection.error_number() != 0) {
    std::fprintf(stderr, ": %s", std::strerror(connection.error_number()));
  }
  std::fprintf(stderr, "\n");
  return 1;
}

// The service's pixels are rows of B, G, R, A with straight alpha, which is
// libpng's PNG_FORMAT_BGRA.
bool save_png(const sds_client_icon& icon, const std::string& path) {
  png_image image;
  std::memset(&image, 0, sizeof image);
  image.version = PNG_IMAGE_VERSION;
  image.width = static_cast<png_uint_32>(icon.width);
  image.height = static_cast<png_uint_32>(icon.height);
  image.format = PNG_FORMAT_BGRA;
  return png_image_write_to_file(&image, path.c_str(), 0, icon.pixels.get(), 0, nullptr) != 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2 || argc > 3) {
    std::fprintf(stderr, "usage: deck-icons OUT_DIR [SOCKET]\n");
    return 2;
  }
  const std::string out_dir = argv[1];
  const std::string socket = argc == 3 ? argv[2] : sds_client_socket_path();

  SdsConnection connection;
  int status = sds_client_connect(socket, connection);
  if (status != SDS_ERROR_NONE) return fail(socket.c_str(), status, connection);

  sds_client_ids ids;
  status = sds_client_get_full_ids(connection, &ids);
  if (status == SDS_ERROR_NO_DATA) return 0;  // an empty deck
  if (status != SDS_ERROR_NONE) return fail("listing the deck", status, connection);

  for (int32_t i = 0; i < ids.count; ++i) {
    sds_client_item item;
    status = sds_client_read_item(connection, ids.ids.get()[i], true, &item);
    if (status != SDS_ERROR_NONE) return fail("reading an item", status, connection);
    std::printf("%d\t%s\t%s\n", item.id, item.title ? item.title.get() : "-",
                item.url ? item.url.get() : "-");
    if (item.icon_status != SDS_ERROR_NONE) continue;  // no icon stored
    const std::string path = out_dir + "/" + std::to_string(item.id) + ".png";
    if (!save_png(item.icon, path)) {
      std::fprintf(stderr, "deck-icons: cannot write %s\n", path.c_str());
      return 1;
    }
  }
  // Closing the connection (here: its destructor) ends the service process.
  return 0;
}
