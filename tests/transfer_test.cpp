// The settings every transfer shares: the proxy rule (seen from a listening
// socket that plays the proxy), the user agent the server receives, the
// next-update-duration file and the refusal of URLs that are not web URLs.
#include <arpa/inet.h>
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <future>
#include <string>

#include "kdb.h"
#include "pull/sitedeck-service-download-icon.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "pull/sitedeck-service-utils.h"
#include "support/db_session.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

constexpr const char* kProxyKey = "memory/connection/proxy";
constexpr const char* kDefaultUserAgent =
    "Mozilla/5.0 (Linux; U; Valto 1.0; en-us) AppleWebKit/534.46 (KHTML, like Gecko) Mobile "
    "Valto Browser/1.0";
constexpr const char* kQuery = "platform=Valto&";

// A listening socket on 127.0.0.1 standing in for a proxy: it takes one
// request, keeps its head and answers 503.
class ProxyProbe {
 public:
  ProxyProbe() {
    fd_.reset(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (!fd_ || bind(fd_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        listen(fd_.get(), 4) != 0 ||
        getsockname(fd_.get(), reinterpret_cast<sockaddr*>(&address), &length) != 0) {
      fd_.reset();
      return;
    }
    port_ = ntohs(address.sin_port);
  }
  int port() const { return port_; }

  // True when a connection is waiting within `timeout_ms`.
  bool pending(int timeout_ms) const {
    pollfd p{fd_.get(), POLLIN, 0};
    return poll(&p, 1, timeout_ms) == 1;
  }
  // Accepts one connection, reads the request head and answers 503; the head,
  // or "" when no request came within 10 s.
  std::string serve_one() const {
    if (!pending(10000)) return "";
    UniqueFd client(accept4(fd_.get(), nullptr, nullptr, SOCK_CLOEXEC));
    std::string head;
    char buffer[1024];
    while (head.find("\r\n\r\n") == std::string::npos) {
      pollfd p{client.get(), POLLIN, 0};
      if (poll(&p, 1, 10000) != 1) break;
      ssize_t n = read(client.get(), buffer, sizeof buffer);
      if (n <= 0) break;
      head.append(buffer, static_cast<size_t>(n));
    }
    static const char kAnswer[] =
        "HTTP/1.1 503 Service Unavailable\r\nContent-Length: 0\r\nConnection: close\r\n\r\n";
    (void)!write(client.get(), kAnswer, sizeof kAnswer - 1);
    return head;
  }

 private:
  UniqueFd fd_;
  int port_ = 0;
};

TEST(TransferSettings, ProxyAddressesThatNameAProxyCarryTheRequest) {
  TempRoot root;
  ProxyProbe probe;
  ASSERT_GT(probe.port(), 0);
  // The origin cannot be resolved: only a proxy can take this request.
  std::string url = "http://origin.test/SiteDeck/getSubRegionalItems?platform=Valto&&hash=ab";
  const std::string proxy_url = "http://127.0.0.1:" + std::to_string(probe.port());
  // With or without a scheme, the transfer is handed the address with one.
  for (const std::string& address : {proxy_url.substr(7), proxy_url}) {
    ASSERT_TRUE(kdb_write(kProxyKey, address.c_str()));
    CURL* curl = curl_easy_init();
    ASSERT_NE(curl, nullptr);
    char* proxy = nullptr;
    EXPECT_EQ(sds_transfer_apply_proxy(curl, &proxy), SDS_ERROR_NONE) << address;
    UniqueCStr owner(proxy);
    curl_easy_cleanup(curl);
    EXPECT_STREQ(proxy, proxy_url.c_str()) << address;
    auto pull = std::async(std::launch::async,
                           [&] { return sds_download_and_parse_json_data(url.c_str()); });
    std::string head = probe.serve_one();
    EXPECT_EQ(pull.get(), SDS_ERROR_SERVER_REQUEST_FAILED) << address;
    EXPECT_EQ(head.substr(0, head.find("\r\n")), "GET " + url + " HTTP/1.1") << address;
  }
}

TEST(TransferSettings, UnusableProxyAddressesLeaveTheTransferDirect) {
  // A database for the list, so that the download succeeds as a whole.
  DbSession db;
  ContentServerProcess content;
  ASSERT_TRUE(content.ok());
  ProxyProbe probe;
  ASSERT_GT(probe.port(), 0);
  std::string url = content.signed_url(kQuery);
  // 0.0.0.0 reaches this machine: a proxy set from it would hit the probe.
  const std::string any_address = "0.0.0.0:" + std::to_string(probe.port());
  int requests = 0;
  for (const std::string& address : {any_address, std::string()}) {
    ASSERT_TRUE(kdb_write(kProxyKey, address.c_str()));
    (void)std::remove(sds_path(SDS_ETAG_PATH).c_str());  // a whole answer each time
    EXPECT_EQ(sds_download_and_parse_json_data(url.c_str()), SDS_ERROR_NONE) << address;
    EXPECT_EQ(content.stats()["item_list_requests"], std::to_string(++requests)) << address;
    EXPECT_EQ(content.stats()["last_path"], "/SiteDeck/getSubRegionalItems") << address;
    EXPECT_FALSE(probe.pending(0)) << address;
  }
}

TEST(TransferSettings, WithoutAConfiguredUserAgentTheDefaultIsSentAndNoted) {
  TempRoot root;
  ContentServerProcess content;
  ASSERT_TRUE(content.ok());
  LogCapture log;
  ASSERT_TRUE(content.control({{"status", "304"}}));
  EXPECT_EQ(sds_download_and_parse_json_data(content.signed_url(kQuery).c_str()),
            SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_EQ(content.stats()["last_user_agent"], kDefaultUserAgent);
  bool noted = false;
  for (const LogLine& line : log.lines()) {
    if (line.message == "No UA information from vconf !!") noted = line.prio == 4;
  }
  EXPECT_TRUE(noted);

  log.clear();
  ASSERT_TRUE(kdb_write("db/browser/user_agent", "TestBrowser/9.1"));
  EXPECT_EQ(sds_download_and_parse_json_data(content.signed_url(kQuery).c_str()),
            SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_EQ(content.stats()["last_user_agent"], "TestBrowser/9.1");
  EXPECT_FALSE(log.contains("No UA information from vconf !!"));
}

TEST(TransferSettings, UnwritableDurationFileIsAnIoError) {
  TempRoot root;
  ASSERT_EQ(rmdir(sds_path(SDS_SERVER_DIR).c_str()), 0);
  sds_last_error = SDS_ERROR_NONE;
  LogCapture log;
  sds_set_next_update_duration(3600);
  EXPECT_EQ(sds_last_error, SDS_ERROR_IO_ERROR);
  EXPECT_TRUE(log.contains("Unable to open file = " + sds_path(SDS_NEXT_UPDATE_DURATION_PATH)));
}

// Icon URLs come from the network: one naming a local file must not be read.
TEST(TransferSettings, IconUrlsThatAreNotWebUrlsAreNotFetched) {
  TempRoot root;
  std::string secret = root.dir() + "/secret.png";
  ASSERT_TRUE(write_file(secret, "not for the network"));
  for (const std::string& url : {"file://" + secret, std::string("ftp://127.0.0.1:1/icon.png")}) {
    sds_icon icon{};
    icon.icon_path = strdup(url.c_str());
    EXPECT_EQ(sds_download_icon(&icon), -1) << url;
    UniqueCStr path(get_icon_path(icon.icon_path));
    ASSERT_TRUE(path);
    EXPECT_EQ(read_file(path.get()), "") << url;
    std::free(icon.icon_path);
  }
}

}  // namespace
