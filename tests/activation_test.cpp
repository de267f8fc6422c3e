// The real service binary, started the ways a device starts it: under the
// activator, with a socket handed over directly, or without activation.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <memory>
#include <string>

#include "client/sitedeck-client-internal.h"
#include "sitedeck-client.h"
#include "serve/sitedeck-service-ipc.h"
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

// The exit code the harness's process ended with; -1 when it did not end.
int exit_code(ServiceHarness& process) {
  int status = 0;
  return process.wait_exit(&status) ? exit_code_of(status) : -1;
}

class Activation : public ::testing::Test {
 protected:
  // A service under the activator, once, and a connection to it.
  void connect_activated() {
    service_ = std::make_unique<ServiceHarness>();
    ASSERT_TRUE(service_->start_activated());
    ASSERT_EQ(service_->connect(&connection_), SDS_ERROR_NONE) << service_->output();
  }

  TempRoot root_;
  std::unique_ptr<ServiceHarness> service_;
  SdsConnection connection_;
};

TEST_F(Activation, WithoutActivationTheServiceExitsWithOneAndCreatesNoSocket) {
  ServiceHarness service;
  ASSERT_TRUE(service.start_unactivated());
  EXPECT_EQ(exit_code(service), 1);
  EXPECT_TRUE(service.has_message("[CRITICAL]  Failed to get the socket")) << service.output();
  EXPECT_FALSE(file_exists(root_.path(SDS_SOCKET_PATH)));
}

// Command 12 gets no reply: the next header (command 0, or one of the cases)
// ends the connection with no byte before the end.
TEST_F(Activation, UnusableHeaderEndsTheConnectionWithoutReply) {
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
    SCOPED_TRACE(c.name);
    connect_activated();
    sds_command header{c.cmd, c.issued_cid ? connection_.cid() : c.cid, 0};
    ASSERT_EQ(sds_client_send_header(connection_, 12, 0), SDS_ERROR_NONE);
    ASSERT_EQ(sds_ipc_send_command(connection_.fd(), &header), 0);
    EXPECT_EQ(bytes_until_end(connection_), 0);
    EXPECT_EQ(exit_code(*service_), 0);
    EXPECT_TRUE(service_->has_message_matching(R"(\[Closed Peer\] sock:\d+ cmd )" +
                                               std::to_string(header.cmd) + " cid " +
                                               std::to_string(header.cid) + " "))
        << service_->output();
  }
}

TEST_F(Activation, SigtermBeforeAnyClientEndsWithStatus255) {
  ServiceHarness service;
  ASSERT_TRUE(service.start_direct());
  ASSERT_TRUE(service.wait_until_accepting()) << service.output();
  ASSERT_TRUE(service.signal(SIGTERM));
  EXPECT_EQ(exit_code(service), 255) << service.output();
  EXPECT_TRUE(service.has_message("[CRITICAL] accept Sitedeck service was crashed ?"));
}

TEST_F(Activation, SigtermWhileServingEndsTheProcessAtOnce) {
  ServiceHarness service;
  ASSERT_TRUE(service.start_direct());
  ASSERT_EQ(service.connect(&connection_), SDS_ERROR_NONE) << service.output();
  ASSERT_TRUE(service.signal(SIGTERM));
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  ASSERT_TRUE(WIFSIGNALED(status)) << service.output();
  EXPECT_EQ(WTERMSIG(status), SIGUSR1);
  EXPECT_EQ(bytes_until_end(connection_), 0);
}

TEST_F(Activation, ActivatorStartsANewServiceForEachConnectionAndCleansUpOnSigterm) {
  ServiceHarness activator;
  ASSERT_TRUE(activator.start_activated(/*once=*/false));
  for (int round = 0; round < 2; ++round) {
    SdsConnection connection;
    ASSERT_EQ(activator.connect(&connection), SDS_ERROR_NONE) << round << activator.output();
    EXPECT_GT(connection.cid(), 0) << round;
  }
  ASSERT_TRUE(activator.signal(SIGTERM));
  EXPECT_EQ(exit_code(activator), 0);
  EXPECT_FALSE(file_exists(activator.socket_path()));
}

TEST_F(Activation, SitedeckHelloPrintsTheClientId) {
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  std::string command =
      std::string(SITEDECK_BIN_DIR) + "/sitedeck --socket '" + service.socket_path() + "' hello";
  FILE* tool = popen(command.c_str(), "r");
  ASSERT_NE(tool, nullptr);
  char line[128] = {};
  bool got_line = std::fgets(line, sizeof line, tool) != nullptr;
  EXPECT_EQ(exit_code_of(pclose(tool)), 0);
  ASSERT_TRUE(got_line);
  int id = 0;
  ASSERT_EQ(std::sscanf(line, "client id: %d\n", &id), 1) << line;
  EXPECT_GT(id, 0);
  EXPECT_EQ(exit_code(service), 0);
}

}  // namespace
