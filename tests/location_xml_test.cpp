#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-request-server.h"
#include "sitedeck-service-server-data.h"
#include "support/log_capture.h"
#include "support/temp_root.h"

namespace {

const std::string kPosition = "37.500000,127.000000";

struct Args : sds_server_req_args {
  Args(double lat, double lon) {
    latitude = lat;
    longitude = lon;
  }
  ~Args() {
    std::free(city);
    std::free(province);
  }
  std::string city_text() const { return city != nullptr ? city : "(none)"; }
  std::string province_text() const { return province != nullptr ? province : "(none)"; }
};

std::string stored(const std::string& inner) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Location>" + inner + "</Location>\n";
}

std::string data(const char* key, const std::string& text) {
  return std::string("<AdditionalData key=\"") + key + "\">" + text + "</AdditionalData>";
}

class LocationXmlTest : public ::testing::Test {
 protected:
  TempRoot root_;
  std::string stored_path_ = root_.path(SDS_LOCATION_INFO_PATH);
  std::string answer_path_ = root_.path(SDS_HERE_XML_PATH);
};

TEST_F(LocationXmlTest, PositionTextHasSixDecimals) {
  UniqueCStr text(get_string_from_location(37.5, 127.0));
  EXPECT_STREQ(text.get(), kPosition.c_str());
  UniqueCStr huge(get_string_from_location(-1e308, 1e308));
  ASSERT_TRUE(huge);
  EXPECT_EQ(std::string(huge.get()).substr(0, 2), "-1");
}

TEST_F(LocationXmlTest, StoredAnswerIsReusedForTheSamePosition) {
  ASSERT_TRUE(write_file(stored_path_, stored("<LatitudeLongitude>" + kPosition +
                                              "</LatitudeLongitude><City>Suwon</City>"
                                              "<Province>Gyeonggi-do</Province>")));
  Args args(37.5, 127.0);
  EXPECT_EQ(get_city_and_province_from_stored(&args), 0);
  EXPECT_EQ(args.city_text(), "Suwon");
  EXPECT_EQ(args.province_text(), "Gyeonggi-do");
}

TEST_F(LocationXmlTest, StoredAnswerOfAnotherPositionIsNotUsed) {
  ASSERT_TRUE(write_file(stored_path_, stored("<LatitudeLongitude>" + kPosition +
                                              "</LatitudeLongitude><City>Suwon</City>"
                                              "<Province>Gyeonggi-do</Province>")));
  LogCapture log;
  Args args(37.500001, 127.0);
  EXPECT_EQ(get_city_and_province_from_stored(&args), -1);
  EXPECT_TRUE(log.contains("Longitude and latitude didn't match with previous"));
  EXPECT_EQ(args.city, nullptr);
  EXPECT_EQ(args.province, nullptr);
}

TEST_F(LocationXmlTest, StoredFileVariants) {
  struct Case {
    const char* name;
    std::string content;
    int result;
    const char* city;
    const char* province;
  } cases[] = {
      {"city without province", stored("<City>Suwon</City>"), 0, "Suwon", "(none)"},
      {"position without text matches", stored("<LatitudeLongitude/><City/><Province>P</Province>"),
       0, "", "P"},
      {"other children skipped", stored("<Note>x</Note><City>C</City>"), 0, "C", "(none)"},
      {"wrong root", "<Place><City>C</City></Place>", 0, "(none)", "(none)"},
      {"not XML", "<Location>", -1, "(none)", "(none)"},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(write_file(stored_path_, c.content));
    LogCapture log;
    Args args(37.5, 127.0);
    EXPECT_EQ(get_city_and_province_from_stored(&args), c.result) << c.name;
    EXPECT_EQ(args.city_text(), c.city) << c.name;
    EXPECT_EQ(args.province_text(), c.province) << c.name;
    if (std::string(c.name) == "wrong root") {
      EXPECT_TRUE(log.contains("Wrong XML data in  - " + stored_path_));
    }
  }
  std::remove(stored_path_.c_str());
  Args args(37.5, 127.0);
  LogCapture log;
  EXPECT_EQ(get_city_and_province_from_stored(&args), -1);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(LocationXmlTest, AnswerGivesLastCountyAndStateAndIsRemoved) {
  ASSERT_TRUE(write_file(
      answer_path_,
      "<?xml version=\"1.0\"?><ns2:Search xmlns:ns2=\"http://www.navteq.com/lbsp/Search-Search/4\">"
      "<Response><View><Result><Location><Address>" +
          data("CountyName", "First County") + data("StateName", "First State") +
          data("Other", "x") + "</Address></Location></Result><Result><Location><Address>" +
          data("CountyName", "Second County") + "<Deeper>" + data("StateName", "Second State") +
          "</Deeper></Address></Location></Result></View></Response></ns2:Search>"));
  Args args(37.5, 127.0);
  args.city = strdup("stale");
  EXPECT_EQ(sds_parse_city_and_province(&args), 0);
  EXPECT_EQ(args.city_text(), "Second County");
  EXPECT_EQ(args.province_text(), "Second State");
  EXPECT_FALSE(file_exists(answer_path_));
}

TEST_F(LocationXmlTest, AnswerWithoutCountyLeavesCityNone) {
  ASSERT_TRUE(write_file(answer_path_, "<Search>" + data("StateName", "") + "</Search>"));
  Args args(37.5, 127.0);
  args.city = strdup("stale");
  EXPECT_EQ(sds_parse_city_and_province(&args), 0);
  EXPECT_EQ(args.city, nullptr);
  EXPECT_EQ(args.province_text(), "");
}

TEST_F(LocationXmlTest, ErrorAnswerGives18AndKeepsTheFile) {
  ASSERT_TRUE(
      write_file(answer_path_, "<ns2:Error xmlns:ns2=\"urn:x\" type=\"PermissionError\"/>"));
  LogCapture log;
  Args args(37.5, 127.0);
  EXPECT_EQ(sds_parse_city_and_province(&args), 18);
  EXPECT_EQ(sds_last_error, 18);
  EXPECT_TRUE(log.contains("[CRITICAL] Here service returned error"));
  EXPECT_TRUE(file_exists(answer_path_));
}

TEST_F(LocationXmlTest, OtherAnswersLeaveCityAndProvinceAlone) {
  Args args(37.5, 127.0);
  args.city = strdup("kept");
  ASSERT_TRUE(write_file(answer_path_, "<Unexpected>" + data("CountyName", "X") + "</Unexpected>"));
  EXPECT_EQ(sds_parse_city_and_province(&args), 0);
  EXPECT_EQ(args.city_text(), "kept");
  EXPECT_TRUE(file_exists(answer_path_));

  LogCapture log;
  std::remove(answer_path_.c_str());
  EXPECT_EQ(sds_parse_city_and_province(&args), 18);
  EXPECT_TRUE(log.contains("[CRITICAL] " + answer_path_ + " file not found"));
  EXPECT_EQ(args.city_text(), "kept");
}

TEST_F(LocationXmlTest, ExternalEntityInAnswerDoesNotReadLocalFiles) {
  const std::string secret = root_.path("/secret.txt");
  ASSERT_TRUE(write_file(secret, "TOP-SECRET"));
  ASSERT_TRUE(write_file(
      answer_path_, "<?xml version=\"1.0\"?>\n<!DOCTYPE Search [<!ENTITY leak SYSTEM \"file://" +
                        secret + "\">]>\n<Search>" + data("CountyName", "&leak;") +
                        data("StateName", "State &leak;") + "</Search>"));
  Args args(37.5, 127.0);
  EXPECT_EQ(sds_parse_city_and_province(&args), 0);
  EXPECT_EQ(args.city_text(), "");
  EXPECT_EQ(args.province_text(), "State ");
}

TEST_F(LocationXmlTest, EntityReferenceInAnswerDoesNotLoopTheWalk) {
  // An entity reference links to its declaration in the DTD; the walk must
  // not follow that link out of the element tree and around again.
  ASSERT_TRUE(write_file(answer_path_, "<!DOCTYPE Search [<!ENTITY town \"Town\">]><Search>" +
                                           data("CountyName", "&town;") + data("StateName", "S") +
                                           "</Search>"));
  Args args(37.5, 127.0);
  EXPECT_EQ(sds_parse_city_and_province(&args), 0);
  EXPECT_EQ(args.city_text(), "Town");
  EXPECT_EQ(args.province_text(), "S");
}

TEST_F(LocationXmlTest, EntityExpansionBombIsRefused) {
  std::string dtd = "<!DOCTYPE Search [<!ENTITY a \"aaaaaaaaaaaaaaaa\">";
  std::string prev = "a";
  for (int level = 1; level <= 9; ++level) {
    std::string name = "e" + std::to_string(level);
    dtd += "<!ENTITY " + name + " \"";
    for (int i = 0; i < 10; ++i) dtd += "&" + prev + ";";
    dtd += "\">";
    prev = name;
  }
  dtd += "]>";
  ASSERT_TRUE(
      write_file(answer_path_, dtd + "<Search>" + data("CountyName", "&e9;") + "</Search>"));
  Args args(37.5, 127.0);
  EXPECT_EQ(sds_parse_city_and_province(&args), 18);
  EXPECT_EQ(args.city, nullptr);
}

TEST_F(LocationXmlTest, OversizeAnswerIsRefusedBeforeParsing) {
  ASSERT_TRUE(write_file(answer_path_, "<Search>" + data("CountyName", "C") +
                                           std::string(1024 * 1024, ' ') + "</Search>"));
  LogCapture log;
  Args args(37.5, 127.0);
  EXPECT_EQ(sds_parse_city_and_province(&args), 18);
  EXPECT_TRUE(log.contains("[CRITICAL] " + answer_path_ + " is larger than 1048576 bytes"));
  EXPECT_EQ(args.city, nullptr);
}

TEST_F(LocationXmlTest, DeepAnswerIsWalkedWithoutRecursion) {
  // libxml2 refuses documents deeper than its own limit; anything it accepts
  // is walked iteratively, to the deepest element.
  std::string open, close;
  for (int i = 0; i < 250; ++i) {
    open += "<n>";
    close = "</n>" + close;
  }
  ASSERT_TRUE(write_file(answer_path_, "<Search>" + open + data("CountyName", "Deep") + close +
                                           data("StateName", "S") + "</Search>"));
  Args args(37.5, 127.0);
  EXPECT_EQ(sds_parse_city_and_province(&args), 0);
  EXPECT_EQ(args.city_text(), "Deep");
  EXPECT_EQ(args.province_text(), "S");
}

TEST_F(LocationXmlTest, WalkCoversTheSiblingsOfTheStartNode) {
  ASSERT_TRUE(write_file(answer_path_, "<Search><a>" + data("CountyName", "One") + "</a><b><c/>" +
                                           data("CountyName", "Two") + "</b></Search>"));
  Args args(37.5, 127.0);
  EXPECT_EQ(sds_parse_city_and_province(&args), 0);
  EXPECT_EQ(args.city_text(), "Two");
}

TEST_F(LocationXmlTest, SaveWritesTheThreeElementsInOrder) {
  Args args(37.5, 127.0);
  args.city = strdup("Suwon & Co");
  args.province = strdup("Gyeonggi-do");
  save_city_and_province(&args);
  EXPECT_EQ(read_file(stored_path_),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Location><LatitudeLongitude>" +
                kPosition +
                "</LatitudeLongitude><City>Suwon &amp; Co</City><Province>Gyeonggi-do</Province>"
                "</Location>\n");
  Args again(37.5, 127.0);
  EXPECT_EQ(get_city_and_province_from_stored(&again), 0);
  EXPECT_EQ(again.city_text(), "Suwon & Co");
  EXPECT_EQ(again.province_text(), "Gyeonggi-do");
}

TEST_F(LocationXmlTest, SaveNeedsCityAndProvince) {
  Args args(37.5, 127.0);
  args.city = strdup("Suwon");
  args.province = strdup("");
  save_city_and_province(&args);
  EXPECT_FALSE(file_exists(stored_path_));

  LogCapture log;
  std::free(args.province);
  args.province = strdup("P");
  std::string missing_dir = root_.dir() + SDS_SERVER_DIR;
  ASSERT_EQ(std::system(("rm -rf '" + missing_dir + "'").c_str()), 0);
  save_city_and_province(&args);
  EXPECT_TRUE(log.contains(
      "|xmlTextWriterEndDocument| failed. Couldn't save city and province information"));
}

}  // namespace
