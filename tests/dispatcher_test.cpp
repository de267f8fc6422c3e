#include <gtest/gtest.h>

#include <climits>

#include "serve/sitedeck-service-ipc.h"
#include "serve/sitedeck-service-request-handler.h"
#include "support/log_capture.h"
#include "support/socket_pair.h"
#include "support/temp_root.h"

namespace {

class DispatcherTest : public ::testing::Test {
 protected:
  void SetUp() override {
    slot_.client_id = 5;
    slot_.sock = pair_.service.get();
  }
  TempRoot root_;  // the dispatcher opens the item database first
  SocketPair pair_;
  sds_client slot_;
  LogCapture log_;
};

TEST_F(DispatcherTest, RefusesMissingSlotAndSocketWithoutReply) {
  sds_command header{3, 5, 1};
  EXPECT_EQ(sds_handle_requests(nullptr, &header), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log_.contains("[ERROR] NULL client"));
  slot_.sock = -1;
  EXPECT_EQ(sds_handle_requests(&slot_, &header), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log_.contains("[ERROR] sock establish"));
  EXPECT_FALSE(readable_now(pair_.peer.get()));
}

// On a peer that has gone, the failed answer ends the connection instead.
TEST_F(DispatcherTest, MissingHeaderIsAnsweredWithInvalidParameter) {
  EXPECT_EQ(sds_handle_requests(&slot_, nullptr), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log_.contains("[ERROR] NULL Command"));
  EXPECT_EQ(sds_ipc_read_errorcode(pair_.peer.get()), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_FALSE(readable_now(pair_.peer.get()));
  pair_.peer.reset();
  EXPECT_EQ(sds_handle_requests(&slot_, nullptr), SDS_ERROR_IO_ERROR);
}

TEST_F(DispatcherTest, UnknownCommandsGetNoReplyAndKeepTheConnection) {
  for (int32_t cmd : {12, 13, 1000, -1, INT_MAX, INT_MIN}) {
    sds_command header{cmd, 5, 0};
    EXPECT_EQ(sds_handle_requests(&slot_, &header), SDS_ERROR_NONE) << cmd;
    EXPECT_EQ(slot_.client_id, 5) << cmd;
  }
  EXPECT_FALSE(readable_now(pair_.peer.get()));
}

}  // namespace
