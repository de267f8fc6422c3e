#include <gtest/gtest.h>
#include <sys/resource.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-server-data.h"
#include "support/log_capture.h"
#include "support/temp_root.h"

namespace {

// The list is released by the data-pull job in the service; tests free it here.
void free_list(sds_server_list* head) {
  while (head != nullptr) {
    sds_server_list* next = head->next;
    std::free(head->server->base_url);
    std::free(head->server);
    std::free(head);
    head = next;
  }
}

struct ServerFields {
  std::string base_url;
  int id, wait_time, retry_count, fall_back;
  bool operator==(const ServerFields&) const = default;
};

std::vector<ServerFields> fields(const sds_server_list* head) {
  std::vector<ServerFields> all;
  for (; head != nullptr; head = head->next) {
    const sds_server_data* s = head->server;
    all.push_back({s->base_url != nullptr ? s->base_url : "(none)", s->id, s->wait_time,
                   s->retry_count, s->fall_back});
  }
  return all;
}

std::string server(const std::string& body) { return "<Server>" + body + "</Server>"; }

std::string values(const std::string& servers) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<values>\n" + servers + "\n</values>\n";
}

class ServerDataTest : public ::testing::Test {
 protected:
  sds_server_list* read(const std::string& xml) {
    EXPECT_TRUE(write_file(path_, xml));
    return sds_get_server_data(path_.c_str());
  }
  TempRoot root_;
  std::string path_ = root_.path(SDS_SERVER_DATA_XML);
};

TEST_F(ServerDataTest, TwoServersInFileOrderAndTheirLogLines) {
  sds_server_list* head = read(values(
      server("<Id>1</Id>\n <Base-url>https://a.example/list</Base-url><WaitTime>5000</WaitTime>"
             "<RetryCount>3</RetryCount><FallBack>false</FallBack>") +
      "<Other><Id>9</Id></Other>" +
      server("<Id>2</Id><Base-url>https://b.example/list</Base-url><WaitTime>100</WaitTime>"
             "<RetryCount>1</RetryCount><FallBack>true</FallBack><Extra>x</Extra>")));
  EXPECT_EQ(fields(head), (std::vector<ServerFields>{{"https://a.example/list", 1, 5000, 3, 0},
                                                     {"https://b.example/list", 2, 100, 1, 1}}));
  LogCapture log;
  print_server_data(head);
  const std::string rule(49, '+');
  std::vector<std::string> expected;
  for (const auto& v : {std::vector<std::string>{"https://a.example/list", "1", "5000", "3", "0"},
                        std::vector<std::string>{"https://b.example/list", "2", "100", "1", "1"}}) {
    expected.insert(expected.end(),
                    {rule, "[INFO] Server base_url    " + v[0], "[INFO] Server Id          " + v[1],
                     "[INFO] Server wait_time   " + v[2], "[INFO] Server retry_count " + v[3],
                     "[INFO] Server fall_back   " + v[4], rule});
  }
  std::vector<std::string> got;
  for (const auto& line : log.lines()) {
    EXPECT_EQ(line.prio, 4) << line.message;
    got.push_back(line.message);
  }
  EXPECT_EQ(got, expected);
  free_list(head);
  print_server_data(nullptr);
}

TEST_F(ServerDataTest, FieldConversions) {
  struct Case {
    const char* body;
    ServerFields expected;
  } cases[] = {
      {"<FallBack>TRUE</FallBack>", {"(none)", 0, 0, 0, 0}},
      {"<FallBack>1</FallBack>", {"(none)", 0, 0, 0, 0}},
      {"<FallBack> true</FallBack>", {"(none)", 0, 0, 0, 0}},
      {"<FallBack>true</FallBack>", {"(none)", 0, 0, 0, 1}},
      {"<WaitTime>5000abc</WaitTime><Id>abc</Id>", {"(none)", 0, 5000, 0, 0}},
      {"<RetryCount>99999999999</RetryCount>", {"(none)", 0, 0, 2147483647, 0}},
      {"<Id>4</Id><Id>5</Id><Base-url>x&amp;y</Base-url><Base-url/>", {"(none)", 5, 0, 0, 0}},
      {"<Base-url>a&amp;b</Base-url><id>3</id>", {"a&b", 0, 0, 0, 0}},
  };
  for (const auto& c : cases) {
    sds_server_list* head = read(values(server(c.body)));
    EXPECT_EQ(fields(head), std::vector<ServerFields>{c.expected}) << c.body;
    free_list(head);
  }
}

TEST_F(ServerDataTest, UnusableFilesGiveNoList) {
  LogCapture log;
  EXPECT_EQ(read("<?xml version=\"1.0\"?><servers><Server/></servers>"), nullptr);
  EXPECT_TRUE(log.contains("[CRITICAL] document of the wrong type, root node != values"));
  EXPECT_EQ(read("<values><Server>"), nullptr);
  EXPECT_TRUE(log.contains("[CRITICAL] " + path_ + " server file not found"));
  EXPECT_EQ(read(values("<Other/>")), nullptr);
  EXPECT_EQ(sds_get_server_data(root_.path("/absent.xml").c_str()), nullptr);
  EXPECT_EQ(read(values(server("<Id>1</Id>") + std::string(1024 * 1024, ' '))), nullptr);
  EXPECT_TRUE(log.contains("[CRITICAL] " + path_ + " is larger than 1048576 bytes"));
}

TEST_F(ServerDataTest, RewrittenUrlWithAmpersandReadsBackUnchanged) {
  ASSERT_TRUE(
      write_file(path_, values(server("<Id>1</Id><Base-url>https://old.example/</Base-url>") +
                               server("<Id>2</Id><Base-url>https://two.example/</Base-url>"
                                      "<Base-url>https://two-b.example/</Base-url>"))));
  const std::string url = "https://new.example/list?a=1&b=<2>&c=\"3\"";
  EXPECT_EQ(sds_update_base_url(path_.c_str(), 2, url.c_str()), 0);
  EXPECT_NE(read_file(path_).find("&amp;b=&lt;2&gt;"), std::string::npos);
  sds_server_list* head = sds_get_server_data(path_.c_str());
  EXPECT_EQ(fields(head),
            (std::vector<ServerFields>{{"https://old.example/", 1, 0, 0, 0}, {url, 2, 0, 0, 0}}));
  free_list(head);
}

TEST_F(ServerDataTest, UnknownIdLeavesTheFileByteForByteUnchanged) {
  struct Case {
    std::string original;
    int result;
  } cases[] = {
      {"<?xml version='1.0'?>\n<!-- installed -->\n<values>\n  <Server>\n    <Id>1</Id>\n"
       "    <Base-url>https://a.example/?x=1&amp;y=2</Base-url>\n  </Server>\n</values>",
       0},
      {"<list/>", -1},  // a file of the wrong kind cannot be rewritten
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(write_file(path_, c.original));
    EXPECT_EQ(sds_update_base_url(path_.c_str(), 7, "https://moved.example/"), c.result);
    EXPECT_EQ(read_file(path_), c.original);
  }
  LogCapture log;
  EXPECT_EQ(sds_update_base_url(root_.path("/absent.xml").c_str(), 1, "u"), -1);
  EXPECT_TRUE(log.contains("[CRITICAL] " + root_.path("/absent.xml") + " server file not found"));
}

TEST_F(ServerDataTest, ServerIsMatchedOnItsFirstIdOnly) {
  const std::string original =
      values(server("<Id>1</Id><Id>2</Id><Base-url>https://a.example/</Base-url>") +
             server("<Id>2</Id><Base-url>https://b.example/</Base-url>"));
  ASSERT_TRUE(write_file(path_, original));
  EXPECT_EQ(sds_update_base_url(path_.c_str(), 2, "https://moved.example/"), 0);
  sds_server_list* head = sds_get_server_data(path_.c_str());
  EXPECT_EQ(fields(head), (std::vector<ServerFields>{{"https://a.example/", 2, 0, 0, 0},
                                                     {"https://moved.example/", 2, 0, 0, 0}}));
  free_list(head);
}

TEST_F(ServerDataTest, RewriteCutShortByAFullDiskLostTheWholeServerList) {
  const std::string original =
      values(server("<Id>1</Id><Base-url>https://a.example/list</Base-url>") +
             server("<Id>2</Id><Base-url>https://b.example/list</Base-url>"));
  ASSERT_TRUE(write_file(path_, original));
  // Writes limited to 64 bytes per file, as on a full disk; SIGXFSZ ignored
  // meanwhile so that a write past the limit just fails.
  struct rlimit saved {};
  ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &saved), 0);
  struct rlimit limited = saved;
  limited.rlim_cur = 64;
  auto* previous = std::signal(SIGXFSZ, SIG_IGN);
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limited), 0);
  (void)sds_update_base_url(path_.c_str(), 1, "https://moved.example/list");
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &saved), 0);
  std::signal(SIGXFSZ, previous);
  // The list as it was, and no half-written file beside it.
  EXPECT_EQ(read_file(path_), original);
  sds_server_list* head = sds_get_server_data(path_.c_str());
  EXPECT_EQ(fields(head), (std::vector<ServerFields>{{"https://a.example/list", 1, 0, 0, 0},
                                                     {"https://b.example/list", 2, 0, 0, 0}}));
  free_list(head);
  size_t files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(root_.path(SDS_SERVER_DIR))) {
    files += entry.is_regular_file();
  }
  EXPECT_EQ(files, 1u);
}

}  // namespace
