#include <fcntl.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "serve/sitedeck-service-ipc.h"
#include "support/log_capture.h"
#include "support/socket_pair.h"

namespace {

class IpcTest : public ::testing::Test {
 protected:
  int service() const { return pair_.service.get(); }
  int peer() const { return pair_.peer.get(); }
  void close_peer() { pair_.peer.reset(); }

  SocketPair pair_;
  LogCapture log_;
};

TEST_F(IpcTest, StringsUpToTheLimitTravelWhole) {
  for (size_t length : {size_t{1}, size_t{1023}, size_t{1025}, size_t{4096}}) {
    std::string text(length, 'x');
    for (size_t i = 0; i < length; ++i) text[i] = static_cast<char>('a' + i % 26);
    ASSERT_EQ(sds_ipc_send_string(service(), text.c_str()), 0) << length;
    UniqueCStr read(sds_ipc_read_string(peer()));
    ASSERT_NE(read, nullptr) << length;
    EXPECT_EQ(std::string(read.get()), text) << length;
  }
}

TEST_F(IpcTest, StringGoesOutAsLengthThenBytesWithoutTerminator) {
  ASSERT_EQ(sds_ipc_send_string(service(), "abc"), 0);
  unsigned char wire[16] = {};
  ASSERT_EQ(read(peer(), wire, sizeof wire), 7);
  const unsigned char expected[7] = {3, 0, 0, 0, 'a', 'b', 'c'};
  EXPECT_EQ(std::memcmp(wire, expected, sizeof expected), 0);
}

TEST_F(IpcTest, SenderRefusesEmptyAndOverlongStringsAndSendsNothing) {
  for (size_t length : {size_t{0}, size_t{4097}}) {
    std::string text(length, 'y');
    EXPECT_EQ(sds_ipc_send_string(service(), text.c_str()), -1) << length;
    EXPECT_TRUE(log_.contains(format("[ERROR] check length:%zu sock:%d", length, service())));
    // The next item is the first thing the peer sees.
    ASSERT_EQ(sds_ipc_send_errorcode(service(), 77), 0);
    EXPECT_EQ(sds_ipc_read_errorcode(peer()), 77) << length;
  }
}

TEST_F(IpcTest, ReaderRefusesBadAnnouncedLengthAndLeavesTheBytes) {
  for (int32_t announced : {4097, 0, -1}) {
    ASSERT_TRUE(write_int(peer(), announced));
    ASSERT_TRUE(write_int(peer(), 1234));
    EXPECT_EQ(sds_ipc_read_string(service()), nullptr) << announced;
    EXPECT_TRUE(log_.contains(format("[ERROR] check length:%d sock:%d", announced, service())))
        << announced;
    EXPECT_EQ(sds_ipc_read_errorcode(service()), 1234) << announced;
  }
}

TEST_F(IpcTest, PeerClosingHalfWayThroughAStringGivesNull) {
  ASSERT_TRUE(write_int(peer(), 10));
  ASSERT_TRUE(write_all(peer(), "abcd", 4));
  close_peer();
  EXPECT_EQ(sds_ipc_read_string(service()), nullptr);
  EXPECT_TRUE(log_.contains(format("[ERROR] closed peer sock:%d", service())));
}

TEST_F(IpcTest, StringReadOnClosedConnectionGivesNullAndStatusReadIsIoError) {
  close_peer();
  EXPECT_EQ(sds_ipc_read_string(service()), nullptr);
  EXPECT_TRUE(log_.contains(format("[ERROR] read length:0 sock:%d", service())));
  EXPECT_EQ(sds_ipc_read_string(-1), nullptr);
  EXPECT_TRUE(log_.contains("[ERROR] check sock:-1"));
  EXPECT_EQ(sds_ipc_read_errorcode(service()), SDS_ERROR_IO_ERROR);
  EXPECT_TRUE(
      log_.contains(format("[ERROR] sds_ipc_read_errorcode closed peer sock:%d", service())));
}

TEST_F(IpcTest, SimpleResponseRefusesCommandZeroAndBadSocketWithoutSending) {
  sds_command zero{0, 5, 1};
  EXPECT_EQ(sds_ipc_simple_response(service(), &zero), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log_.contains(format("[ERROR] check command(0) sock:%d", service())));
  sds_command valid{3, 5, 1};
  EXPECT_EQ(sds_ipc_simple_response(-1, &valid), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log_.contains("[ERROR] check sock:-1"));
  EXPECT_FALSE(readable_now(peer()));
}

TEST_F(IpcTest, SimpleResponseSendsTheHeaderAndReturnsTheStatus) {
  ASSERT_TRUE(write_int(peer(), SDS_ERROR_NO_DATA));
  sds_command header{3, 42, 7};
  EXPECT_EQ(sds_ipc_simple_response(service(), &header), SDS_ERROR_NO_DATA);
  std::vector<int32_t> wire(4, -1);
  ASSERT_EQ(read(peer(), wire.data(), 16), 12);
  EXPECT_EQ(wire, (std::vector<int32_t>{3, 42, 7, -1}));
}

TEST_F(IpcTest, RecvTriesThreeTimesWhenTheReadWouldBlock) {
  ASSERT_EQ(fcntl(service(), F_SETFL, O_NONBLOCK), 0);
  char buffer[4];
  EXPECT_EQ(sds_ipc_recv(service(), buffer, sizeof buffer, "probe"), -1);
  EXPECT_EQ(log_.count(format("[IPC.Read] probe exception sock:%d", service())), 3);
  EXPECT_EQ(log_.count(format("[EAGAIN:%d] [%s]", EAGAIN, strerror(EAGAIN))), 3);
}

TEST_F(IpcTest, RecvReturnsWhatOneReadDeliveredAndRefusesBadSocketAndBuffer) {
  ASSERT_TRUE(write_all(peer(), "ab", 2));
  char buffer[12] = {};
  EXPECT_EQ(sds_ipc_recv(service(), buffer, sizeof buffer, "probe"), 2);
  EXPECT_STREQ(buffer, "ab");
  EXPECT_EQ(sds_ipc_recv(-1, buffer, sizeof buffer, "probe"), -1);
  EXPECT_TRUE(log_.contains("[ERROR] probe check sock:-1"));
  EXPECT_EQ(sds_ipc_recv(service(), nullptr, 4, "probe"), -1);
  EXPECT_TRUE(log_.contains(format("[ERROR] probe check buffer sock:%d", service())));
}

TEST_F(IpcTest, CheckStderrMapsErrnoToCodes) {
  struct Case {
    int err;
    int default_code;
    int code;
    std::string message;
  } cases[] = {
      {EPIPE, 1, SDS_ERROR_IO_ERROR, format("[EPIPE:%d] Broken Pipe [%s]", EPIPE, strerror(EPIPE))},
      {EAGAIN, 1, SDS_ERROR_IO_EAGAIN, format("[EAGAIN:%d] [%s]", EAGAIN, strerror(EAGAIN))},
      {EINTR, 1, SDS_ERROR_IO_EINTR, format("[EINTR:%d] [%s]", EINTR, strerror(EINTR))},
      {ENOENT, 9, 9, format("[errno:%d] [%s]", ENOENT, strerror(ENOENT))},
  };
  for (const auto& c : cases) {
    errno = c.err;
    EXPECT_EQ(sds_ipc_check_stderr(c.default_code), c.code) << c.message;
    EXPECT_TRUE(log_.contains(c.message)) << c.message;
  }
}

TEST_F(IpcTest, WriteToVanishedPeerFailsWithoutKillingTheProcess) {
  close_peer();
  EXPECT_EQ(sds_ipc_send_errorcode(service(), 0), -1);
  EXPECT_TRUE(
      log_.contains(format("[IPC.Write] exception sock:%d [%s]", service(), strerror(EPIPE))));
}

TEST_F(IpcTest, WritersRefuseBadSocketAndBuffer) {
  sds_command header{1, 1, 0};
  int value = 0;
  EXPECT_EQ(sds_ipc_send_errorcode(-1, 0), -1);
  EXPECT_EQ(sds_ipc_send_command(-1, &header), -1);
  EXPECT_EQ(sds_ipc_send_custom_type(-1, &value, sizeof value), -1);
  EXPECT_EQ(sds_ipc_send_string(-1, "x"), -1);
  EXPECT_EQ(log_.count("[ERROR] check sock:-1"), 4);
  EXPECT_EQ(sds_ipc_send_custom_type(service(), nullptr, 4), -1);
  EXPECT_EQ(sds_ipc_send_string(service(), nullptr), -1);
  EXPECT_EQ(log_.count(format("[ERROR] check buffer sock:%d", service())), 2);
  EXPECT_FALSE(readable_now(peer()));
}

TEST_F(IpcTest, CustomTypeAndCommandGoOutAsRawBytes) {
  const double location[2] = {52.5, -13.25};
  ASSERT_EQ(sds_ipc_send_custom_type(service(), location, sizeof location), 0);
  double read_back[2] = {};
  ASSERT_EQ(sds_ipc_read_custom_type(peer(), read_back, sizeof read_back), 0);
  EXPECT_EQ(read_back[0], 52.5);
  EXPECT_EQ(read_back[1], -13.25);
  close_peer();
  EXPECT_EQ(sds_ipc_read_custom_type(service(), read_back, sizeof read_back), -1);
}

TEST_F(IpcTest, BlobIsReadWholeAcrossChunks) {
  std::vector<unsigned char> pixels(3000);
  for (size_t i = 0; i < pixels.size(); ++i) pixels[i] = static_cast<unsigned char>(i * 7);
  ASSERT_TRUE(write_all(peer(), pixels.data(), pixels.size()));
  std::vector<unsigned char> read_back(pixels.size());
  EXPECT_EQ(sds_ipc_read_blob(service(), read_back.data(), read_back.size()), 0);
  EXPECT_EQ(read_back, pixels);
}

TEST_F(IpcTest, BlobRefusesZeroSizeAndReportsEarlyClose) {
  char buffer[200];
  EXPECT_EQ(sds_ipc_read_blob(service(), buffer, 0), -1);
  EXPECT_TRUE(log_.contains(format("[ERROR] check size:0 sock:%d", service())));
  EXPECT_EQ(sds_ipc_read_blob(service(), nullptr, 4), -1);
  EXPECT_TRUE(log_.contains(format("[ERROR] check buffer sock:%d", service())));
  ASSERT_TRUE(write_all(peer(), buffer, 100));
  close_peer();
  EXPECT_EQ(sds_ipc_read_blob(service(), buffer, sizeof buffer), -1);
  EXPECT_TRUE(log_.contains(format("[ERROR] closed peer sock:%d", service())));
}

TEST_F(IpcTest, ReadIntStoresTheValueAndGivesMinusOneForClosedPeer) {
  ASSERT_TRUE(write_int(peer(), 86400));
  int value = 0;
  EXPECT_EQ(sds_ipc_read_int(service(), &value), 86400);
  EXPECT_EQ(value, 86400);
  close_peer();
  EXPECT_EQ(sds_ipc_read_int(service(), &value), -1);
  EXPECT_EQ(value, -1);
  EXPECT_EQ(sds_ipc_read_int(-1, &value), -1);
  EXPECT_TRUE(log_.contains("[CHECK SOCKET]"));
}

}  // namespace
