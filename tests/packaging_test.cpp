// The installation as a package makes it (`cmake --install` below a staging
// directory) and what uses it: systemd's own tools, the installed service and
// module, a client program built out of this tree; the service under
// systemd's socket activation; and the short soak run of tools/soak.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <string>

#include "pull/sitedeck-service-utils.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/staged_install.h"
#include "support/temp_root.h"
#include "tools/soak/proc_stats.h"

namespace {

namespace fs = std::filesystem;

#if defined(__SANITIZE_ADDRESS__)
constexpr bool kUnderAddressSanitizer = true;
#elif defined(__has_feature)
constexpr bool kUnderAddressSanitizer = __has_feature(address_sanitizer);
#else
constexpr bool kUnderAddressSanitizer = false;
#endif

const std::string kBin = SITEDECK_INSTALL_BINDIR;
const std::string kLib = SITEDECK_INSTALL_LIBDIR;
const std::string kModule = std::string(SITEDECK_INSTALL_MODULEDIR) + "/libsitedeck-pull.so";
const std::string kShare = std::string(SITEDECK_INSTALL_DATADIR) + "/browser-sitedeck-service";
const std::string kUnits = "lib/systemd/system/browser-sitedeck-service.";

// Every file below `dir`, relative to it, with whether it may be executed.
std::map<std::string, bool> files_below(const std::string& dir) {
  std::map<std::string, bool> files;
  for (const auto& entry : fs::recursive_directory_iterator(dir)) {
    if (entry.is_directory()) continue;
    files[entry.path().lexically_relative(dir).string()] =
        (entry.status().permissions() & fs::perms::owner_exec) != fs::perms::none;
  }
  return files;
}

std::vector<uint8_t> png_pixels(const std::string& path) {
  const std::string png = read_file(path);
  unsigned char* raw = nullptr;
  int width = 0, height = 0, size = 0;
  if (convert_png_to_raw_data(reinterpret_cast<const unsigned char*>(png.data()), png.size(), &raw,
                              &width, &height, &size) != 0) {
    return {};
  }
  UniqueMalloc<unsigned char> owner(raw);
  return std::vector<uint8_t>(raw, raw + size);
}

// Skips the case when `tool` is missing, or fails it when the environment
// requires the systemd tools.
#define REQUIRE_TOOL(variable, tool)                                              \
  std::string variable = find_program(tool);                                      \
  if (variable.empty()) {                                                         \
    if (systemd_tools_required()) FAIL() << tool " is missing (package systemd)"; \
    GTEST_SKIP() << tool " is not installed (package systemd); skipped";          \
  }

class Packaging : public ::testing::Test {
 protected:
  void SetUp() override { install("/usr", stage_); }
  void install(const std::string& prefix, const std::string& stage) {
    ProcessResult result = install_staged(stage, prefix);
    ASSERT_EQ(result.exit_code, 0) << result.out << result.err;
  }
  TempRoot root_;
  const std::string stage_ = root_.dir() + "/stage";
};

// For each prefix: exactly the expected files with their executable bits, and
// units and a tmpfiles.d entry naming the installed files for that prefix.
TEST_F(Packaging, InstallPutsEveryFileInPlaceAndNamesItForEachPrefix) {
  for (const std::string prefix : {"/usr", "/opt/sitedeck"}) {
    SCOPED_TRACE(prefix);
    const std::string stage = prefix == "/usr" ? stage_ : root_.dir() + "/other-stage";
    if (stage != stage_) install(prefix, stage);
    const std::string p = prefix.substr(1) + "/", cmake = p + kLib + "/cmake/SitedeckClient/";
    std::map<std::string, bool> expected = {
        {p + kBin + "/browser-sitedeck-service", true}, {p + kBin + "/sitedeck", true},
        {p + kBin + "/sitedeck-activator", true}, {p + kModule, false},
        {p + kLib + "/libsitedeck-client.so", false}, {p + kLib + "/libsitedeck-client.so.1", false},
        {p + kLib + "/libsitedeck-client.so." SITEDECK_PROJECT_VERSION, false},
        {p + kLib + "/pkgconfig/sitedeck-client.pc", false},
        {cmake + "SitedeckClientConfig.cmake", false},
        {cmake + "SitedeckClientConfigVersion.cmake", false},
        {cmake + "SitedeckClientTargets.cmake", false},
        {cmake + "SitedeckClientTargets-" SITEDECK_BUILD_TYPE_LOWER ".cmake", false},
        {p + kShare + "/site_deck_server_data.xml", false}, {p + kUnits + "socket", false},
        {p + kUnits + "service", false}, {p + "lib/tmpfiles.d/browser-sitedeck-service.conf", false}};
    for (const char* header : {"", "-commands", "-deck", "-status"}) {
      expected[p + "include/sitedeck-client" + header + ".h"] = false;
    }
    for (const char* name : {"site_deck_default.json", "news-96.png", "mail-96.png", "maps-96.png",
                             "weather-96.png", "video-96.png", "shop-96.png", "wiki-96.png"}) {
      expected[p + kShare + "/default-deck/" + name] = false;
    }
    std::map<std::string, bool> installed = files_below(stage);
    // Libraries are loaded, never executed: their executable bit is the platform's custom.
    for (auto& [path, executable] : installed) {
      if (path.find(".so") != std::string::npos) executable = false;
    }
    EXPECT_EQ(installed, expected);
    const std::string server_list = prefix + "/" + kShare + "/site_deck_server_data.xml";
    EXPECT_EQ(read_file(stage + server_list),
              read_file(SITEDECK_SOURCE_DIR "/packaging/site_deck_server_data.xml"));
    const std::string base = stage + prefix + "/";
    std::string service = read_file(base + kUnits + "service");
    std::string socket = read_file(base + kUnits + "socket");
    std::string tmpfiles = read_file(base + "lib/tmpfiles.d/browser-sitedeck-service.conf");
    EXPECT_EQ(unit_setting(service, "ExecStart"), prefix + "/" + kBin + "/browser-sitedeck-service");
    EXPECT_EQ(unit_setting(service, "ReadWritePaths"), SDS_DATA_DIR);
    EXPECT_EQ(unit_setting(socket, "ListenStream"), SDS_SOCKET_PATH);
    EXPECT_EQ(unit_setting(socket, "Accept"), "no");
    EXPECT_NE(tmpfiles.find("C " SDS_SERVER_DATA_XML " - - - - " + server_list + "\n"),
              std::string::npos) << tmpfiles;
    EXPECT_EQ((service + tmpfiles).find("@SITEDECK_"), std::string::npos) << "a placeholder was left";
  }
}

// The entry makes the data directories and copies the server list and the
// default deck once: the service rewrites the list when a server moves for
// good, and running the entry again (every boot does) must keep that.
TEST_F(Packaging, TmpfilesCreatesTheDataDirectoriesAndCopiesTheServerListOnce) {
  REQUIRE_TOOL(tmpfiles, "systemd-tmpfiles");
  const std::vector<std::string> create = {tmpfiles, "--create", "--root=" + stage_,
                                           stage_ + "/usr/lib/tmpfiles.d/browser-sitedeck-service.conf"};
  ProcessResult result = run_process(create);
  ASSERT_EQ(result.exit_code, 0) << result.err;
  for (const auto& [path, mode] : std::map<std::string, mode_t>{
           {SDS_DATA_DIR, 0755}, {SDS_SERVER_DIR, 0750}, {SDS_DATABASE_DIR, 0700}, {SDS_IMAGES_DIR, 0700}}) {
    struct stat info {};
    EXPECT_TRUE(stat((stage_ + path).c_str(), &info) == 0 && S_ISDIR(info.st_mode)) << path;
    EXPECT_EQ(info.st_mode & 07777, mode) << path;
  }
  const std::string server_list = stage_ + SDS_SERVER_DATA_XML;
  EXPECT_EQ(read_file(server_list), read_file(stage_ + "/usr/" + kShare + "/site_deck_server_data.xml"));
  EXPECT_EQ(read_file(stage_ + SDS_DEFAULT_DECK_JSON_PATH),
            read_file(stage_ + "/usr/" + kShare + "/default-deck/site_deck_default.json"));
  EXPECT_TRUE(file_exists(stage_ + SDS_DEFAULT_DECK_DIR + std::string("/wiki-96.png")));
  const std::string moved = "<values><Server><Id>1</Id></Server></values>\n";
  ASSERT_TRUE(write_file(server_list, moved));
  EXPECT_EQ(run_process(create).exit_code, 0);
  EXPECT_EQ(read_file(server_list), moved);
}

// Verified below --root, with systemd's own units copied beside them for the
// default dependencies; the sandbox rated by systemd (0 tight to 10 open):
// the network, /dev/shm and root's chown alone cost about 2.5.
TEST_F(Packaging, SystemdAcceptsTheInstalledUnitsAndTheirSandbox) {
  REQUIRE_TOOL(analyze, "systemd-analyze");
  std::string units;
  for (const char* dir : {"/usr/lib/systemd/system", "/lib/systemd/system"}) {
    if (units.empty() && file_exists(std::string(dir) + "/sockets.target")) units = dir;
  }
  if (units.empty()) {
    if (systemd_tools_required()) FAIL() << "systemd's own units are missing";
    GTEST_SKIP() << "systemd's own units (sockets.target) are not installed; skipped";
  }
  fs::create_directories(stage_ + "/lib/systemd");
  fs::copy(units, stage_ + "/lib/systemd/system",
           fs::copy_options::recursive | fs::copy_options::copy_symlinks);
  ProcessResult verify = run_process({analyze, "verify", "--root=" + stage_,
                                      "browser-sitedeck-service.socket", "browser-sitedeck-service.service"});
  EXPECT_EQ(verify.exit_code, 0) << verify.err;
  EXPECT_EQ(verify.err, "");  // unknown or misspelt settings are only warned about
  ProcessResult security = run_process({analyze, "security", "--offline=yes", "--threshold=30",
                                        "--root=" + stage_, "browser-sitedeck-service.service"});
  EXPECT_EQ(security.exit_code, 0) << security.out << security.err;
}

// The installed binary lives apart from its module (bin/ and lib/) and loads
// the one of its own installation, only for the first initialize: a process
// that only serves the deck maps none of the pull's libraries.
TEST_F(Packaging, InstalledServiceLoadsItsInstalledPullModuleOnlyForAPull) {
  const auto mapped = [](pid_t pid) {
    std::ifstream maps("/proc/" + std::to_string(pid) + "/maps");
    std::set<std::string> found;
    for (std::string line; std::getline(maps, line);) {
      for (const char* library : {"/libcurl", "/libxml2", "/libjson-glib", "/libpng", "/libsitedeck-pull"}) {
        if (line.find(library) != std::string::npos) found.insert(line.substr(line.find('/')));
      }
    }
    return found;
  };
  ServiceHarness service;
  service.set_service_path(stage_ + "/usr/" + kBin + "/browser-sitedeck-service");
  ASSERT_TRUE(service.start_direct());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  int32_t seconds = 0;
  ASSERT_EQ(sds_client_get_next_update_duration(connection, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(mapped(service.pid()), std::set<std::string>{});
  // No server list: the pull runs and fails, which it can only do with the module.
  EXPECT_EQ(sds_client_initialize(connection, 37.5, 127.25, "1.0"), SDS_ERROR_DATA_PULL_FAILED);
  EXPECT_EQ(mapped(service.pid()).count(fs::canonical(stage_ + "/usr/" + kModule).string()), 1u);
  EXPECT_FALSE(service.has_message_matching(R"(\[CRITICAL\] cannot load .*)")) << service.output();
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();  // under the sanitizers: no leak either
}

// What a browser developer does: a program of their own, built out of this
// tree against the installed client library (once with pkg-config, once with
// find_package), lists the deck of the real service and saves an icon as PNG,
// which decodes to the stored pixels.
TEST_F(Packaging, ClientProgramBuiltOutOfTreeListsTheDeckAndSavesAnIcon) {
  const std::string prefix = stage_ + "/usr", example = SITEDECK_SOURCE_DIR "/client/examples";
  const std::string by_pkg_config = root_.dir() + "/deck-icons-pc", by_cmake = root_.dir() + "/cmake-build";
  for (const auto& build : std::vector<std::vector<std::string>>{
           {"/bin/sh", "-c",
            SITEDECK_CXX_COMPILER " -std=c++17 " SITEDECK_EXAMPLE_FLAGS " -o " + by_pkg_config + " " +
                example + "/deck-icons.cpp $(PKG_CONFIG_PATH=" + prefix + "/" + kLib +
                "/pkgconfig pkg-config --cflags --libs sitedeck-client libpng)"},
           {SITEDECK_CMAKE_COMMAND, "-S", example, "-B", by_cmake, "-DCMAKE_PREFIX_PATH=" + prefix,
            "-DCMAKE_CXX_COMPILER=" SITEDECK_CXX_COMPILER, "-DCMAKE_CXX_FLAGS=" SITEDECK_EXAMPLE_FLAGS},
           {SITEDECK_CMAKE_COMMAND, "--build", by_cmake}}) {
    ProcessResult result = run_process(build, 120000);
    ASSERT_EQ(result.exit_code, 0) << build.back() << "\n" << result.out << result.err;
  }
  SeedItem news = seed_item(7, "https://news.example/", "News", 1);
  news.icon_data = seed_pixels(4, 3, 7);
  news.icon_size = "4x3";
  ASSERT_TRUE(seed_deck({news, seed_item(3, "https://mail.example/", "Mail", 2)}));
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated(/*once=*/false));
  for (const std::string& program : {by_pkg_config, by_cmake + "/deck-icons"}) {
    SCOPED_TRACE(program);
    const std::string out_dir = root_.dir() + "/icons-" + fs::path(program).filename().string();
    fs::create_directories(out_dir);
    ProcessResult result =
        run_process({"/usr/bin/env", "LD_LIBRARY_PATH=" + prefix + "/" + kLib, program, out_dir});
    EXPECT_EQ(result.exit_code, 0) << result.err;
    EXPECT_EQ(result.out, "7\tNews\thttps://news.example/\n3\tMail\thttps://mail.example/\n");
    EXPECT_EQ(files_below(out_dir), (std::map<std::string, bool>{{"7.png", false}}));
    EXPECT_EQ(png_pixels(out_dir + "/7.png"), seed_pixels(4, 3, 7));
  }
}

// systemd's own systemd-socket-activate listens, waits for the first
// connection and execs the service with the listening socket as descriptor 3
// (as the socket unit does with Accept=no); the service ends with its
// connection, in the process that was started.
TEST(SocketActivate, ServiceUnderSystemdActivationServesOneConnectionAndEnds) {
  REQUIRE_TOOL(activate, "systemd-socket-activate");
  TempRoot root;
  ASSERT_TRUE(seed_deck({seed_item(7, "https://seven.example/", "Seven", 1),
                         seed_item(3, "https://three.example/", "Three", 0)}));
  const std::string socket_path = root.path(SDS_SOCKET_PATH);
  fs::create_directories(fs::path(socket_path).parent_path());  // the socket unit's part
  // A fresh environment: the root, and the sanitizers' settings, passed on.
  std::string command = "timeout 60 " + activate + " -l " + socket_path + " -E SITEDECK_ROOT=" + root.dir();
  for (const char* name : {"ASAN_OPTIONS", "UBSAN_OPTIONS", "LSAN_OPTIONS"}) {
    if (std::getenv(name) != nullptr) command += std::string(" -E ") + name + "=" + std::getenv(name);
  }
  FILE* child = popen((command + " " SITEDECK_BIN_DIR "/browser-sitedeck-service 2>&1").c_str(), "r");
  ASSERT_NE(child, nullptr);
  std::string output;
  char line[4096];
  while (output.find("Listening on") == std::string::npos && std::fgets(line, sizeof line, child)) {
    output += line;
  }
  SdsConnection connection;
  EXPECT_EQ(sds_client_connect(socket_path, connection, {20000, 20000}), SDS_ERROR_NONE) << output;
  sds_client_ids ids;
  SdsClientText title;
  EXPECT_EQ(sds_client_get_full_ids(connection, &ids), SDS_ERROR_NONE);
  EXPECT_EQ(std::vector<int32_t>(ids.ids.get(), ids.ids.get() + ids.count), (std::vector<int32_t>{3, 7}));
  EXPECT_EQ(sds_client_get_title(connection, 7, &title), SDS_ERROR_NONE);
  EXPECT_STREQ(title.get(), "Seven");
  EXPECT_EQ(sds_client_release_shm(connection), SDS_ERROR_NONE);  // which ends the connection
  while (std::fgets(line, sizeof line, child)) output += line;
  EXPECT_EQ(exit_code_of(pclose(child)), 0) << output;
  EXPECT_NE(output.find("listen systemd socket:3"), std::string::npos) << output;
}

// The short version of tools/soak, through the activator: one connection
// serves a thousand requests, then twenty connections follow; descriptors
// and mappings of the service and the activator stay flat, SIGTERM ends the
// activator and removes its socket, and the data directories keep no file.
TEST(Soak, RequestsAndConnectionsLeaveDescriptorsAndMappingsFlatAndNothingBehind) {
  constexpr int kItems = 12, kIconBytes = 57 * 57 * 4;
  TempRoot root;
  std::vector<SeedItem> items;
  for (int i = 1; i <= kItems; ++i) {
    items.push_back(seed_item(i, "http://site-" + std::to_string(i) + ".example/", "Site", i));
    items.back().touch_icon_exists = 1;
    items.back().icon_size = "57x57";
    items.back().icon_data = seed_pixels(57, 57, i);
  }
  ASSERT_TRUE(seed_deck(items));
  ASSERT_TRUE(write_file(root.path(SDS_NEXT_UPDATE_DURATION_PATH), "3600"));
  const auto files = [&] {
    std::set<std::string> found;
    for (const auto& e : fs::recursive_directory_iterator(root.path(SDS_DATA_DIR))) {
      if (e.is_regular_file()) found.insert(e.path().string());
    }
    return found;
  };
  const std::set<std::string> files_before = files();
  // Request `n` of a mix of commands 3, 5, 7, 10 and 11: true when answered right.
  const auto request = [](SdsConnection& c, long n) {
    const auto id = static_cast<int32_t>(1 + (n / 5) % kItems);
    SdsClientText text;
    int32_t value = 0;
    sds_client_icon icon;
    sds_client_ids ids;
    switch (n % 5) {
      case 0: return sds_client_get_url(c, id, &text) == SDS_ERROR_NONE;
      case 1: return sds_client_get_touch_icon_exists(c, id, &value) == SDS_ERROR_NONE && value == 1;
      case 2: return sds_client_get_icon(c, id, &icon) == SDS_ERROR_NONE && icon.byte_count == kIconBytes;
      case 3: return sds_client_get_next_update_duration(c, &value) == SDS_ERROR_NONE && value == 3600;
      default: return sds_client_get_ids_by_dirty(c, 1, &ids) == SDS_ERROR_NONE && ids.count == kItems;
    }
  };
  ServiceHarness activator;
  ASSERT_TRUE(activator.start_activated(/*once=*/false));
  long failures = 0;
  ProcStats settled, first_activator, service_first;
  for (int round = 0; round <= 20; ++round) {
    SdsConnection connection;
    ASSERT_EQ(activator.connect(&connection), SDS_ERROR_NONE) << activator.output();
    const std::vector<pid_t> services = proc_children(activator.pid());
    ASSERT_EQ(services.size(), 1u);
    for (long n = 0; n < (round == 0 ? 1000 : 5); ++n) {
      failures += request(connection, round * 5 + n) ? 0 : 1;
      // The first requests settle the database pages and the libraries' caches.
      if (round == 0 && n == 199) settled = proc_stats(services[0]);
    }
    const ProcStats now = proc_stats(services[0]);
    if (round == 0) {
      ASSERT_GT(settled.fds, 0);
      EXPECT_EQ(now.fds, settled.fds);
      EXPECT_EQ(now.mappings, settled.mappings);
      // 200 icons copy 2.6 MB through the service; none of it may stay. (Under
      // AddressSanitizer freed memory is quarantined; its leak check stands in.)
      EXPECT_TRUE(kUnderAddressSanitizer || now.rss_kb - settled.rss_kb < 2048) << now.rss_kb;
      first_activator = proc_stats(activator.pid());
    } else {
      if (round == 1) service_first = now;
      EXPECT_EQ(now.fds, service_first.fds) << round;
      EXPECT_LE(std::abs(now.mappings - service_first.mappings), 16) << round;
    }
    EXPECT_EQ(sds_client_release_shm(connection), SDS_ERROR_NONE);
  }
  EXPECT_EQ(failures, 0);
  const ProcStats last = proc_stats(activator.pid());
  EXPECT_EQ(last.fds, first_activator.fds);
  EXPECT_EQ(last.mappings, first_activator.mappings);
  ASSERT_TRUE(activator.signal(SIGTERM));
  int status = 0;
  ASSERT_TRUE(activator.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0);
  EXPECT_FALSE(file_exists(activator.socket_path()));
  EXPECT_EQ(files(), files_before);
}

}  // namespace
