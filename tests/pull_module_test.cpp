// The service binary and its pull module: a process that only serves the
// deck never loads the libraries of the data pull, the first initialize
// loads the module beside the binary, and a binary without its module
// answers initialize with SDS_ERROR_DATA_PULL_FAILED and keeps serving.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>

#include "sitedeck-client-commands.h"
#include "sitedeck-client.h"
#include "sitedeck-service-paths.h"
#include "support/service_harness.h"
#include "support/temp_root.h"

namespace {

const char* const kPullLibraries[] = {"libcurl", "libxml2", "libjson-glib", "libpng",
                                      "libsitedeck-pull"};

// The pull libraries mapped into process `pid`, separated by blanks.
std::string pull_libraries_mapped(pid_t pid) {
  std::ifstream maps("/proc/" + std::to_string(pid) + "/maps");
  std::string line, found;
  while (std::getline(maps, line)) {
    for (const char* library : kPullLibraries) {
      if (line.find(std::string("/") + library) != std::string::npos &&
          found.find(library) == std::string::npos) {
        found += std::string(found.empty() ? "" : " ") + library;
      }
    }
  }
  return found;
}

// The names `file` defines for the dynamic linker (nm -D), without versions.
// Weak definitions (inline and template code every object file carries, the
// same everywhere) are left out.
std::set<std::string> dynamic_definitions(const std::string& file) {
  std::set<std::string> names;
  std::string command = "nm -D --defined-only '" + file + "' 2>/dev/null";
  FILE* pipe = popen(command.c_str(), "r");
  if (pipe == nullptr) return names;
  char line[4096];
  while (std::fgets(line, sizeof line, pipe) != nullptr) {
    char type = 0;
    char symbol[4096] = {};
    if (std::sscanf(line, "%*s %c %4095s", &type, symbol) != 2) continue;
    if (type == 'W' || type == 'V' || type == 'w' || type == 'v' || type == 'u') continue;
    if (std::strchr(symbol, '@') == nullptr) names.insert(symbol);
  }
  (void)pclose(pipe);
  return names;
}

// What the module uses of the service must come from the binary, not from a
// copy of the same module file inside it: a copy keeps state of its own (a
// cache, a handle) that the binary's code never sees, and nothing fails.
TEST(PullModule, ModuleCarriesNoCopyOfWhatTheBinaryExports) {
  const std::string bin = SITEDECK_BIN_DIR;
  std::set<std::string> binary = dynamic_definitions(bin + "/browser-sitedeck-service");
  std::set<std::string> module = dynamic_definitions(bin + "/libsitedeck-pull.so");
  ASSERT_FALSE(binary.empty());
  ASSERT_FALSE(module.empty());
  std::string both;
  for (const auto& name : module) {
    if (binary.count(name) != 0) both += " " + name;
  }
  EXPECT_EQ(both, "") << "defined in both the binary and the module; such a module file belongs "
                         "to SERVE_SOURCES in CMakeLists.txt";
}

TEST(PullModule, ServingLoadsNoPullLibraryAndInitializeLoadsTheModule) {
  TempRoot root;
  ServiceHarness service;
  ASSERT_TRUE(service.start_direct());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  int32_t seconds = 0;
  ASSERT_EQ(sds_client_get_next_update_duration(connection, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(pull_libraries_mapped(service.pid()), "");

  // No server list: the pull itself fails, after the module was loaded.
  EXPECT_EQ(sds_client_initialize(connection, 37.5, 127.25, "1.0"), SDS_ERROR_DATA_PULL_FAILED);
  EXPECT_NE(pull_libraries_mapped(service.pid()).find("libsitedeck-pull"), std::string::npos);
  EXPECT_FALSE(service.has_message_matching(R"(\[CRITICAL\] cannot load .*)"));
  // The process with the module in it ends as cleanly (and, under the
  // sanitizers, without a leak report) as one without.
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
}

TEST(PullModule, BinaryWithoutItsModuleAnswersInitializeWith21AndKeepsServing) {
  TempRoot root;
  std::filesystem::path copy = root.dir() + "/bin/browser-sitedeck-service";
  std::filesystem::create_directories(copy.parent_path());
  std::filesystem::copy_file(std::string(SITEDECK_BIN_DIR) + "/browser-sitedeck-service", copy);
  ServiceHarness service;
  service.set_service_path(copy.string());
  ASSERT_TRUE(service.start_direct());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();

  EXPECT_EQ(sds_client_initialize(connection, 37.5, 127.25, "1.0"), SDS_ERROR_DATA_PULL_FAILED);
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(seconds, 86400);
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_TRUE(service.has_message_matching(
      R"(\[CRITICAL\] cannot load .*/bin/libsitedeck-pull\.so \[.*\])"))
      << service.output();
}

}  // namespace
