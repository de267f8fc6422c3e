// A staged installation used as a package is; systemd's socket activation;
// and the short soak run of tools/soak.
#include <gtest/gtest.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/png_maker.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/staged_install.h"
#include "support/temp_root.h"
#include "tools/soak/proc_stats.h"

namespace {

namespace fs = std::filesystem;

// A program built out of this tree against the installed client library
// (with pkg-config and with find_package) lists the deck of the installed
// service and saves an icon as PNG. That service loads the module of its own
// installation (bin/ and lib/ apart), and only for a pull.
TEST(Packaging, ClientProgramBuiltOutOfTreeListsTheDeckAndSavesAnIcon) {
  TempRoot root;
  const std::string usr = root.dir() + "/stage/usr/";
  ProcessResult installed = install_staged(root.dir() + "/stage", "/usr");
  ASSERT_EQ(installed.exit_code, 0) << installed.out << installed.err;
  const std::string example = SITEDECK_SOURCE_DIR "/client/examples";
  const std::string lib = usr + SITEDECK_INSTALL_LIBDIR;
  const std::string by_pkg_config = root.dir() + "/deck-icons-pc";
  const std::string by_cmake = root.dir() + "/cmake-build";
  for (const auto& build : std::vector<std::vector<std::string>>{
           {"/bin/sh", "-c",
            SITEDECK_CXX_COMPILER " -std=c++17 " SITEDECK_EXAMPLE_FLAGS " -o " + by_pkg_config +
                " " + example + "/deck-icons.cpp $(PKG_CONFIG_PATH=" + lib +
                "/pkgconfig pkg-config --cflags --libs sitedeck-client libpng)"},
           {SITEDECK_CMAKE_COMMAND, "-S", example, "-B", by_cmake, "-DCMAKE_PREFIX_PATH=" + usr,
            "-DCMAKE_CXX_COMPILER=" SITEDECK_CXX_COMPILER,
            "-DCMAKE_CXX_FLAGS=" SITEDECK_EXAMPLE_FLAGS},
           {SITEDECK_CMAKE_COMMAND, "--build", by_cmake}}) {
    ProcessResult result = run_process(build, 120000);
    ASSERT_EQ(result.exit_code, 0) << build.back() << "\n" << result.out << result.err;
  }
  SeedItem news = seed_item(7, "https://news.example/", "News", 1);
  news.icon_data = seed_pixels(4, 3, 7);
  news.icon_size = "4x3";
  ASSERT_TRUE(seed_deck({news, seed_item(3, "https://mail.example/", "Mail", 2)}));
  const std::string service = usr + SITEDECK_INSTALL_BINDIR "/browser-sitedeck-service";
  ServiceHarness activated, direct;
  activated.set_service_path(service);
  ASSERT_TRUE(activated.start_activated(/*once=*/false));
  for (const std::string& program : {by_pkg_config, by_cmake + "/deck-icons"}) {
    SCOPED_TRACE(program);
    const std::string out = root.dir() + "/icons-" + fs::path(program).filename().string();
    fs::create_directories(out);
    ProcessResult result = run_process({"/usr/bin/env", "LD_LIBRARY_PATH=" + lib, program, out});
    EXPECT_EQ(result.exit_code, 0) << result.err;
    EXPECT_EQ(result.out, "7\tNews\thttps://news.example/\n3\tMail\thttps://mail.example/\n");
    EXPECT_EQ(std::distance(fs::directory_iterator(out), {}), 1);
    EXPECT_EQ(service_decode_png(read_file(out + "/7.png")), seed_pixels(4, 3, 7));
  }
  int status = 0;
  ASSERT_TRUE(activated.signal(SIGTERM) && activated.wait_exit(&status));
  const auto mapped = [&](const std::string& library) {
    return read_file("/proc/" + std::to_string(direct.pid()) + "/maps").find(library) !=
           std::string::npos;
  };
  direct.set_service_path(service);
  ASSERT_TRUE(direct.start_direct());
  SdsConnection connection;
  ASSERT_EQ(direct.connect(&connection), SDS_ERROR_NONE) << direct.output();
  int32_t seconds = 0;
  ASSERT_EQ(sds_client_get_next_update_duration(connection, &seconds), SDS_ERROR_NONE);
  for (const char* library :
       {"/libcurl", "/libxml2", "/libjson-glib", "/libpng", "/libsitedeck-pull"}) {
    EXPECT_FALSE(mapped(library)) << library;
  }
  // No server list: the pull runs and fails, which it can only do with the module.
  EXPECT_EQ(sds_client_initialize(connection, 37.5, 127.25, "1.0"), SDS_ERROR_DATA_PULL_FAILED);
  const std::string module = usr + SITEDECK_INSTALL_MODULEDIR "/libsitedeck-pull.so";
  EXPECT_TRUE(mapped(fs::canonical(module).string() + "\n"));
  connection.close();  // and it ends as cleanly, without a leak under the sanitizers
  ASSERT_TRUE(direct.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << direct.output();
}

// systemd-socket-activate execs the service on the first connection with the
// socket as descriptor 3 (as the unit with Accept=no); it ends with it.
TEST(SocketActivate, ServiceUnderSystemdActivationServesOneConnectionAndEnds) {
  const std::string activate = find_program("systemd-socket-activate");
  if (activate.empty()) {
    if (systemd_tools_required()) FAIL() << "systemd-socket-activate (package systemd) is missing";
    GTEST_SKIP() << "systemd-socket-activate (package systemd) is not installed";
  }
  TempRoot root;
  ASSERT_TRUE(seed_deck({seed_item(7, "https://seven.example/", "Seven", 1),
                         seed_item(3, "https://three.example/", "Three", 0)}));
  const std::string socket_path = root.path(SDS_SOCKET_PATH);
  fs::create_directories(fs::path(socket_path).parent_path());  // the socket unit's part
  // A fresh environment: the root, and the sanitizers' settings, passed on.
  std::string command =
      "timeout 60 " + activate + " -l " + socket_path + " -E SITEDECK_ROOT=" + root.dir();
  for (const char* name : {"ASAN_OPTIONS", "UBSAN_OPTIONS", "LSAN_OPTIONS"}) {
    if (std::getenv(name) != nullptr) command += std::string(" -E ") + name + "=" + getenv(name);
  }
  command += " " SITEDECK_BIN_DIR "/browser-sitedeck-service 2>&1";
  FILE* child = popen(command.c_str(), "r");
  ASSERT_NE(child, nullptr);
  std::string output;
  for (char line[4096]; output.find("Listening on") == output.npos && fgets(line, 4096, child);) {
    output += line;
  }
  SdsConnection connection;
  EXPECT_EQ(sds_client_connect(socket_path, connection, {20000, 20000}), SDS_ERROR_NONE) << output;
  sds_client_ids ids;
  EXPECT_EQ(sds_client_get_full_ids(connection, &ids), SDS_ERROR_NONE);
  EXPECT_EQ(std::vector<int32_t>(ids.ids.get(), ids.ids.get() + ids.count),
            (std::vector<int32_t>{3, 7}));
  EXPECT_EQ(sds_client_release_shm(connection), SDS_ERROR_NONE);  // which ends the connection
  for (char line[4096]; fgets(line, 4096, child);) output += line;
  EXPECT_EQ(exit_code_of(pclose(child)), 0) << output;
  EXPECT_NE(output.find("listen systemd socket:3"), std::string::npos) << output;
}

// tools/soak made short, on 1001 sites: 1000 requests on one connection, then 20
// connections, descriptors and mappings flat (AddressSanitizer checks leaks at
// exit); the preview shows the first 1000; SIGTERM ends the activator, unlinks.
TEST(Soak, RequestsAndConnectionsLeaveDescriptorsAndMappingsFlatAndNothingBehind) {
  TempRoot root;
  std::vector<SeedItem> items;
  for (int i = 1; i <= 1001; ++i) {
    items.push_back(seed_item(i, "http://site-" + std::to_string(i) + ".example/", "Site", i));
    if (i > 12) continue;
    items.back().icon_size = "57x57";
    items.back().icon_data = seed_pixels(57, 57, i);
  }
  ASSERT_TRUE(seed_deck(items));
  ServiceHarness activator;
  ASSERT_TRUE(activator.start_activated(/*once=*/false));
  long failures = 0;
  ProcStats settled, activator_first, service_first;
  for (int round = 0; round <= 20; ++round) {
    SdsConnection c;
    ASSERT_EQ(activator.connect(&c), SDS_ERROR_NONE) << activator.output();
    const std::vector<pid_t> services = proc_children(activator.pid());
    ASSERT_EQ(services.size(), 1u);
    for (int n = 0; n < (round == 0 ? 1000 : 4); ++n) {  // commands 3, 7, 10 and 11 in turn
      const auto id = static_cast<int32_t>(1 + (n / 4) % 12);
      SdsClientText url;
      int32_t seconds = 0;
      sds_client_icon icon;
      sds_client_ids ids;
      const bool right = n % 4 == 0   ? sds_client_get_url(c, id, &url) == 0
                         : n % 4 == 1 ? sds_client_get_icon(c, id, &icon) == 0 && icon.width == 57
                         : n % 4 == 2
                             ? sds_client_get_next_update_duration(c, &seconds) == 0
                             : sds_client_get_ids_by_dirty(c, 1, &ids) == 0 && ids.count == 1001;
      failures += right ? 0 : 1;
      // The first requests settle the database pages and the libraries' caches.
      if (round == 0 && n == 199) settled = proc_stats(services[0]);
    }
    const ProcStats now = proc_stats(services[0]);
    if (round == 0) activator_first = proc_stats(activator.pid());
    if (round == 1) service_first = now;
    const ProcStats& before = round == 0 ? settled : service_first;
    EXPECT_EQ(now.fds, before.fds) << round;
    EXPECT_LE(std::abs(now.mappings - before.mappings), round == 0 ? 0 : 16) << round;
    EXPECT_EQ(sds_client_release_shm(c), SDS_ERROR_NONE);
  }
  EXPECT_EQ(failures, 0);
  ProcessResult render = run_process({SITEDECK_BIN_DIR "/sitedeck", "--socket",
                                      activator.socket_path(), "render", root.dir() + "/big"});
  EXPECT_EQ(render.err,
            "sitedeck: render: the deck has 1001 live sites; the page shows the first 1000\n");
  const std::string page = read_file(root.dir() + "/big/index.html");
  EXPECT_NE(page.find("data-id=\"1000\""), page.npos);
  EXPECT_EQ(page.find("data-id=\"1001\""), page.npos);
  const ProcStats last = proc_stats(activator.pid());
  EXPECT_EQ(last.fds, activator_first.fds);
  EXPECT_EQ(last.mappings, activator_first.mappings);
  ASSERT_TRUE(activator.signal(SIGTERM));
  int status = 0;
  ASSERT_TRUE(activator.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0);
  EXPECT_FALSE(file_exists(activator.socket_path()));
}

}  // namespace
