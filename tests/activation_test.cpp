// The real service binary, started the ways a device starts it: under the
// activator, with a socket handed over directly, or without activation.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <string>

#include "sitedeck-client.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"
#include "support/service_harness.h"
#include "support/temp_root.h"

namespace {

// Reads from the connection until it ends; the count of bytes that came
// before the end, or -1 when the bounded read gave up first.
int bytes_until_end(const SdsConnection& connection) {
  int total = 0;
  char buffer[64];
  for (;;) {
    ssize_t n = read(connection.fd(), buffer, sizeof buffer);
    if (n == 0) return total;
    if (n < 0) return -1;
    total += static_cast<int>(n);
  }
}

TEST(Activation, WithoutActivationTheServiceExitsWithOneAndCreatesNoSocket) {
  TempRoot root;
  ServiceHarness service;
  ASSERT_TRUE(service.start_unactivated());
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 1);
  EXPECT_TRUE(service.has_message("[CRITICAL]  Failed to get the socket")) << service.output();
  EXPECT_FALSE(file_exists(root.path(SDS_SOCKET_PATH)));
}

TEST(Activation, ClientGetsTheHandshakeAndItsCloseEndsTheServiceWithStatusZero) {
  TempRoot root;
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  EXPECT_GT(connection.cid(), 0);
  struct stat st {};
  ASSERT_EQ(stat(SDS_SHM_FILE_PATH, &st), 0);
  EXPECT_EQ(static_cast<size_t>(st.st_size), SDS_SHM_SIZE);

  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
  EXPECT_TRUE(service.has_message_matching(R"(disconnect client:-1 sock:\d+)")) << service.output();
}

TEST(Activation, UnusableHeaderEndsTheConnectionWithoutReply) {
  struct Case {
    const char* name;
    int32_t cmd;
    int32_t cid;
    bool issued_cid;  // send the id the service issued instead of `cid`
  } cases[] = {
      {"command 0", 0, 0, true},
      {"cid 0", 3, 0, false},
      {"negative cid", 3, -1, false},
  };
  for (const auto& c : cases) {
    TempRoot root;
    ServiceHarness service;
    ASSERT_TRUE(service.start_activated()) << c.name;
    SdsConnection connection;
    ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << c.name;
    sds_command header{c.cmd, c.issued_cid ? connection.cid() : c.cid, 0};
    ASSERT_EQ(sds_ipc_send_command(connection.fd(), &header), 0) << c.name;
    EXPECT_EQ(bytes_until_end(connection), 0) << c.name;
    int status = 0;
    ASSERT_TRUE(service.wait_exit(&status)) << c.name;
    EXPECT_EQ(exit_code_of(status), 0) << c.name;
    std::string expected = R"(\[Closed Peer\] sock:\d+ cmd )" + std::to_string(header.cmd) +
                           " cid " + std::to_string(header.cid) + " ";
    EXPECT_TRUE(service.has_message_matching(expected)) << c.name << "\n" << service.output();
  }
}

TEST(Activation, UnknownCommandGetsNoReplyAndTheNextRequestIsServed) {
  TempRoot root;
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE);
  ASSERT_EQ(sds_client_send_header(connection, 12, 0), SDS_ERROR_NONE);
  // The next header is read and judged: command 0 ends the connection, so
  // an end of stream with no byte before it shows that 12 got no reply.
  ASSERT_EQ(sds_client_send_header(connection, 0, 0), SDS_ERROR_NONE);
  EXPECT_EQ(bytes_until_end(connection), 0);
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0);
  std::string expected =
      R"(\[Closed Peer\] sock:\d+ cmd 0 cid )" + std::to_string(connection.cid()) + " ";
  EXPECT_TRUE(service.has_message_matching(expected)) << service.output();
}

TEST(Activation, SigtermBeforeAnyClientEndsWithStatus255) {
  TempRoot root;
  ServiceHarness service;
  ASSERT_TRUE(service.start_direct());
  ASSERT_TRUE(service.wait_until_accepting()) << service.output();
  ASSERT_TRUE(service.signal(SIGTERM));
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 255) << service.output();
  EXPECT_TRUE(service.has_message("[CRITICAL] accept Sitedeck service was crashed ?"));
}

TEST(Activation, SigtermWhileServingEndsTheProcessAtOnce) {
  TempRoot root;
  ServiceHarness service;
  ASSERT_TRUE(service.start_direct());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  ASSERT_TRUE(service.signal(SIGTERM));
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  ASSERT_TRUE(WIFSIGNALED(status)) << service.output();
  EXPECT_EQ(WTERMSIG(status), SIGUSR1);
  EXPECT_EQ(bytes_until_end(connection), 0);
}

TEST(Activation, ActivatorStartsANewServiceForEachConnectionAndCleansUpOnSigterm) {
  TempRoot root;
  ServiceHarness activator;
  ASSERT_TRUE(activator.start_activated(/*once=*/false));
  for (int round = 0; round < 2; ++round) {
    SdsConnection connection;
    ASSERT_EQ(activator.connect(&connection), SDS_ERROR_NONE) << round << activator.output();
    EXPECT_GT(connection.cid(), 0) << round;
    connection.close();
  }
  ASSERT_TRUE(activator.signal(SIGTERM));
  int status = 0;
  ASSERT_TRUE(activator.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0);
  EXPECT_FALSE(file_exists(activator.socket_path()));
}

TEST(Activation, SitedeckHelloPrintsTheClientId) {
  TempRoot root;
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  std::string command =
      std::string(SITEDECK_BIN_DIR) + "/sitedeck --socket '" + service.socket_path() + "' hello";
  FILE* tool = popen(command.c_str(), "r");
  ASSERT_NE(tool, nullptr);
  char line[128] = {};
  bool got_line = std::fgets(line, sizeof line, tool) != nullptr;
  int tool_status = pclose(tool);
  ASSERT_TRUE(got_line);
  EXPECT_EQ(exit_code_of(tool_status), 0);
  int id = 0;
  ASSERT_EQ(std::sscanf(line, "client id: %d\n", &id), 1) << line;
  EXPECT_GT(id, 0);
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0);
}

TEST(Activation, SitedeckNamesTheStatusWhenNoServiceListens) {
  TempRoot root;
  std::string command = std::string(SITEDECK_BIN_DIR) + "/sitedeck --socket '" +
                        root.path(SDS_SOCKET_PATH) + "' hello 2>&1";
  FILE* tool = popen(command.c_str(), "r");
  ASSERT_NE(tool, nullptr);
  std::string output;
  char buffer[256];
  while (std::fgets(buffer, sizeof buffer, tool) != nullptr) output += buffer;
  EXPECT_EQ(exit_code_of(pclose(tool)), 1);
  EXPECT_EQ(output, "sitedeck: cannot reach the site deck service at " +
                        root.path(SDS_SOCKET_PATH) +
                        ": there is no socket file (is the socket unit running?)\n");
}

}  // namespace
