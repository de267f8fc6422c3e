// The installation as a package would make it: the files `cmake --install`
// puts below a staging directory, the units and the tmpfiles.d entry filled
// in for the prefix, the installed service finding its installed pull
// module, a program built out of this tree against the installed client
// library, and systemd's own tools (systemd-tmpfiles, systemd-analyze)
// accepting what was installed.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <string>

#include "sitedeck-client-commands.h"
#include "sitedeck-client.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-utils.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/staged_install.h"
#include "support/temp_root.h"

namespace {

namespace fs = std::filesystem;

const std::string kBin = SITEDECK_INSTALL_BINDIR;
const std::string kModuleDir = SITEDECK_INSTALL_MODULEDIR;
const std::string kLibDir = SITEDECK_INSTALL_LIBDIR;
const std::string kShareDir = std::string(SITEDECK_INSTALL_DATADIR) + "/browser-sitedeck-service";
const std::string kUnitDir = "lib/systemd/system";

// Every file below `dir`, relative to it, with whether it may be executed.
std::map<std::string, bool> files_below(const std::string& dir) {
  std::map<std::string, bool> files;
  for (const auto& entry : fs::recursive_directory_iterator(dir)) {
    if (entry.is_directory()) continue;
    bool executable = (entry.status().permissions() & fs::perms::owner_exec) != fs::perms::none;
    files[entry.path().lexically_relative(dir).string()] = executable;
  }
  return files;
}

mode_t mode_of(const std::string& path) {
  struct stat info {};
  return stat(path.c_str(), &info) == 0 ? (info.st_mode & 07777) : 0;
}

// Installs for `prefix` below `stage`; a failed installation fails the case.
void install_or_fail(const std::string& stage, const std::string& prefix) {
  ProcessResult result = install_staged(stage, prefix);
  ASSERT_TRUE(result.finished);
  ASSERT_EQ(result.exit_code, 0) << result.out << result.err;
}

// Skips the case when `tool` is missing, or fails it when the environment
// requires the systemd tools; returns the tool's path otherwise.
#define REQUIRE_TOOL(variable, tool)                                              \
  std::string variable = find_program(tool);                                      \
  if (variable.empty()) {                                                         \
    if (systemd_tools_required()) FAIL() << tool " is missing (package systemd)"; \
    GTEST_SKIP() << tool " is not installed (package systemd); skipped";          \
  }

// Every case starts from an installation for /usr below `stage_`.
class Packaging : public ::testing::Test {
 protected:
  void SetUp() override { install_or_fail(stage_, "/usr"); }
  TempRoot root_;
  const std::string stage_ = root_.dir() + "/stage";
};

// For each prefix chosen when installing: exactly the expected files with
// their executable bits, and units and a tmpfiles.d entry that name the
// installed files for that prefix, not the one of the build.
TEST_F(Packaging, InstallPutsEveryFileInPlaceAndNamesItForEachPrefix) {
  for (const std::string prefix : {"/usr", "/opt/sitedeck"}) {
    SCOPED_TRACE(prefix);
    const std::string stage = prefix == "/usr" ? stage_ : root_.dir() + "/other-stage";
    if (stage != stage_) install_or_fail(stage, prefix);
    const std::string base = stage + prefix;
    // Below the stage, and whether it must be executable. Test, benchmark,
    // fuzzing and stand-in programs stay in the build tree.
    const std::string p = prefix.substr(1) + "/";
    std::map<std::string, bool> expected = {
        {p + kBin + "/browser-sitedeck-service", true},
        {p + kBin + "/sitedeck", true},
        {p + kBin + "/sitedeck-activator", true},
        {p + kModuleDir + "/libsitedeck-pull.so", false},
        {p + kLibDir + "/libsitedeck-client.so", false},
        {p + kLibDir + "/libsitedeck-client.so.1", false},
        {p + kLibDir + "/libsitedeck-client.so." + SITEDECK_PROJECT_VERSION, false},
        {p + kLibDir + "/pkgconfig/sitedeck-client.pc", false},
        {p + kLibDir + "/cmake/SitedeckClient/SitedeckClientConfig.cmake", false},
        {p + kLibDir + "/cmake/SitedeckClient/SitedeckClientConfigVersion.cmake", false},
        {p + kLibDir + "/cmake/SitedeckClient/SitedeckClientTargets.cmake", false},
        {p + kLibDir + "/cmake/SitedeckClient/SitedeckClientTargets-" + SITEDECK_BUILD_TYPE_LOWER + ".cmake",
         false},
        {p + kShareDir + "/site_deck_server_data.xml", false},
        {p + kUnitDir + "/browser-sitedeck-service.socket", false},
        {p + kUnitDir + "/browser-sitedeck-service.service", false},
        {p + "lib/tmpfiles.d/browser-sitedeck-service.conf", false},
    };
    for (const char* header : {"sitedeck-client.h", "sitedeck-client-commands.h",
                               "sitedeck-client-deck.h", "sitedeck-client-status.h"}) {
      expected[p + "include/" + header] = false;
    }
    // The sample default deck: its item list and every icon it names.
    for (const char* name : {"site_deck_default.json", "news-96.png", "mail-96.png", "maps-96.png",
                             "weather-96.png", "video-96.png", "shop-96.png", "wiki-96.png"}) {
      expected[p + kShareDir + "/default-deck/" + name] = false;
    }
    std::map<std::string, bool> installed = files_below(stage);
    // Libraries are loaded, never executed: whether they carry the
    // executable bit is the platform's custom.
    for (auto& [path, executable] : installed) {
      if (path.find(".so") != std::string::npos) executable = false;
    }
    EXPECT_EQ(installed, expected);
    // The sample server list is the one in the source tree, byte for byte.
    const std::string server_list = prefix + "/" + kShareDir + "/site_deck_server_data.xml";
    EXPECT_EQ(read_file(stage + server_list),
              read_file(std::string(SITEDECK_SOURCE_DIR) + "/packaging/site_deck_server_data.xml"));

    std::string service = read_file(base + "/" + kUnitDir + "/browser-sitedeck-service.service");
    EXPECT_EQ(unit_setting(service, "ExecStart"),
              prefix + "/" + kBin + "/browser-sitedeck-service");
    EXPECT_EQ(unit_setting(service, "ReadWritePaths"), SDS_DATA_DIR);
    std::string socket = read_file(base + "/" + kUnitDir + "/browser-sitedeck-service.socket");
    EXPECT_EQ(unit_setting(socket, "ListenStream"), SDS_SOCKET_PATH);
    EXPECT_EQ(unit_setting(socket, "Accept"), "no");
    std::string tmpfiles = read_file(base + "/lib/tmpfiles.d/browser-sitedeck-service.conf");
    EXPECT_NE(
        tmpfiles.find(std::string("C ") + SDS_SERVER_DATA_XML + " - - - - " + server_list + "\n"),
        std::string::npos)
        << tmpfiles;
    EXPECT_EQ((service + tmpfiles).find("@SITEDECK_"), std::string::npos)
        << "a placeholder was left";
  }
}

// The installed binary lives apart from its module (bin/ and lib/): it must
// still load the module, and the one of its own installation.
TEST_F(Packaging, InstalledServiceLoadsItsInstalledPullModule) {
  ServiceHarness service;
  service.set_service_path(stage_ + "/usr/" + kBin + "/browser-sitedeck-service");
  ASSERT_TRUE(service.start_direct());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();

  // No server list in the root: the pull runs and fails, which it can only
  // do once the module is loaded.
  EXPECT_EQ(sds_client_initialize(connection, 37.5, 127.25, "1.0"), SDS_ERROR_DATA_PULL_FAILED);
  std::ifstream maps("/proc/" + std::to_string(service.pid()) + "/maps");
  std::string line, mapped_module;
  while (std::getline(maps, line)) {
    size_t at = line.find("/libsitedeck-pull.so");
    if (at != std::string::npos) mapped_module = line.substr(line.find('/'));
  }
  std::string installed_module = stage_ + "/usr/" + kModuleDir + "/libsitedeck-pull.so";
  EXPECT_EQ(fs::path(mapped_module), fs::canonical(installed_module));
  EXPECT_FALSE(service.has_message_matching(R"(\[CRITICAL\] cannot load .*)")) << service.output();
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
}

// What a browser developer does: a program of their own, built out of this
// tree against the installed client library (once with pkg-config, once with
// find_package), lists the deck of the real service and saves an icon as
// PNG, which decodes to the stored pixels.
TEST_F(Packaging, ClientProgramBuiltOutOfTreeListsTheDeckAndSavesAnIcon) {
  const std::string prefix = stage_ + "/usr";
  const std::string example = std::string(SITEDECK_SOURCE_DIR) + "/client/examples";
  const std::string flags = SITEDECK_EXAMPLE_FLAGS;
  const std::string pkg_config = "PKG_CONFIG_PATH=" + prefix + "/" + kLibDir + "/pkgconfig ";
  const std::string by_pkg_config = root_.dir() + "/deck-icons-pc";
  const std::string by_cmake = root_.dir() + "/cmake-build";
  std::vector<std::vector<std::string>> builds = {
      {"/bin/sh", "-c",
       std::string(SITEDECK_CXX_COMPILER) + " -std=c++17 " + flags + " -o " + by_pkg_config + " " +
           example + "/deck-icons.cpp $(" + pkg_config +
           "pkg-config --cflags --libs sitedeck-client libpng)"},
      {SITEDECK_CMAKE_COMMAND, "-S", example, "-B", by_cmake, "-DCMAKE_PREFIX_PATH=" + prefix,
       std::string("-DCMAKE_CXX_COMPILER=") + SITEDECK_CXX_COMPILER, "-DCMAKE_CXX_FLAGS=" + flags},
      {SITEDECK_CMAKE_COMMAND, "--build", by_cmake},
  };
  for (const auto& build : builds) {
    ProcessResult result = run_process(build, 120000);
    ASSERT_TRUE(result.finished);
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
    ProcessResult result = run_process(
        {"/usr/bin/env", "LD_LIBRARY_PATH=" + prefix + "/" + kLibDir, program, out_dir});
    ASSERT_TRUE(result.finished);
    EXPECT_EQ(result.exit_code, 0) << result.err;
    EXPECT_EQ(result.out, "7\tNews\thttps://news.example/\n3\tMail\thttps://mail.example/\n");
    EXPECT_EQ(files_below(out_dir), (std::map<std::string, bool>{{"7.png", false}}));
    const std::string png = read_file(out_dir + "/7.png");
    unsigned char* raw = nullptr;
    int width = 0, height = 0, size = 0;
    ASSERT_EQ(convert_png_to_raw_data(reinterpret_cast<const unsigned char*>(png.data()),
                                      png.size(), &raw, &width, &height, &size),
              0);
    UniqueMalloc<unsigned char> pixels(raw);
    EXPECT_EQ(std::vector<uint8_t>(raw, raw + size), seed_pixels(4, 3, 7));
  }
}

TEST_F(Packaging, TmpfilesCreatesTheDataDirectoriesAndCopiesTheServerListOnce) {
  REQUIRE_TOOL(tmpfiles, "systemd-tmpfiles");
  // The entry is read from the stage_; its paths, the copy's source included,
  // are taken below --root.
  const std::vector<std::string> create = {
      tmpfiles, "--create", "--root=" + stage_,
      stage_ + "/usr/lib/tmpfiles.d/browser-sitedeck-service.conf"};
  ProcessResult result = run_process(create);
  ASSERT_TRUE(result.finished);
  ASSERT_EQ(result.exit_code, 0) << result.err;

  const struct {
    const char* path;
    mode_t mode;
  } dirs[] = {
      {SDS_DATA_DIR, 0755},
      {SDS_SERVER_DIR, 0750},
      {SDS_DATABASE_DIR, 0700},
      {SDS_IMAGES_DIR, 0700},
  };
  for (const auto& d : dirs) {
    SCOPED_TRACE(d.path);
    EXPECT_TRUE(fs::is_directory(stage_ + d.path));
    EXPECT_EQ(mode_of(stage_ + d.path), d.mode);
  }
  std::string server_list = stage_ + SDS_SERVER_DATA_XML;
  std::string sample = read_file(stage_ + "/usr/" + kShareDir + "/site_deck_server_data.xml");
  EXPECT_EQ(read_file(server_list), sample);
  // The default deck arrives whole, ready for a first start.
  EXPECT_EQ(read_file(stage_ + SDS_DEFAULT_DECK_JSON_PATH),
            read_file(stage_ + "/usr/" + kShareDir + "/default-deck/site_deck_default.json"));
  EXPECT_TRUE(file_exists(stage_ + SDS_DEFAULT_DECK_DIR + std::string("/wiki-96.png")));

  // The service rewrites the list when a server moves for good: running the
  // entry again (every boot does) must keep that.
  const std::string moved = "<values><Server><Id>1</Id></Server></values>\n";
  ASSERT_TRUE(write_file(server_list, moved));
  result = run_process(create);
  ASSERT_TRUE(result.finished);
  ASSERT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(read_file(server_list), moved);
}

TEST_F(Packaging, SystemdAcceptsTheInstalledUnitsAndTheirSandbox) {
  REQUIRE_TOOL(analyze, "systemd-analyze");
  std::string system_units;
  for (const char* dir : {"/usr/lib/systemd/system", "/lib/systemd/system"}) {
    if (system_units.empty() && file_exists(std::string(dir) + "/sockets.target"))
      system_units = dir;
  }
  if (system_units.empty()) {
    if (systemd_tools_required()) FAIL() << "systemd's own units are missing";
    GTEST_SKIP() << "systemd's own units (sockets.target) are not installed; skipped";
  }
  // Verifying below --root checks ExecStart in the stage_; the units' default
  // dependencies (sysinit.target, sockets.target) must be found there too,
  // so systemd's own units are copied beside them.
  fs::create_directories(stage_ + "/lib/systemd");
  fs::copy(system_units, stage_ + "/lib/systemd/system",
           fs::copy_options::recursive | fs::copy_options::copy_symlinks);

  ProcessResult verify =
      run_process({analyze, "verify", "--root=" + stage_, "browser-sitedeck-service.socket",
                   "browser-sitedeck-service.service"});
  ASSERT_TRUE(verify.finished);
  EXPECT_EQ(verify.exit_code, 0) << verify.err;
  // Unknown or misspelt settings are only warned about.
  EXPECT_EQ(verify.err, "");

  // systemd's own rating of the sandbox, 0 (tight) to 10 (open): the service
  // needs the network, /dev/shm and root's chown, which alone cost about 2.5.
  ProcessResult security = run_process({analyze, "security", "--offline=yes", "--threshold=30",
                                        "--root=" + stage_, "browser-sitedeck-service.service"});
  ASSERT_TRUE(security.finished);
  EXPECT_EQ(security.exit_code, 0) << security.out << security.err;
}

}  // namespace
