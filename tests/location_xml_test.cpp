#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"
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
  // Writes `answer` as the geocoder's answer and reads it into `args_`:
  // "RESULT CITY|PROVINCE", "(none)" for a text not set.
  std::string parse(const std::string& answer) {
    EXPECT_TRUE(write_file(answer_path_, answer));
    const int result = sds_parse_city_and_province(&args_);
    return std::to_string(result) + " " + args_.city_text() + "|" + args_.province_text();
  }
  TempRoot root_;
  std::string stored_path_ = root_.path(SDS_LOCATION_INFO_PATH);
  std::string answer_path_ = root_.path(SDS_HERE_XML_PATH);
  Args args_{37.5, 127.0};
};

TEST_F(LocationXmlTest, PositionTextHasSixDecimals) {
  UniqueCStr text(get_string_from_location(37.5, 127.0));
  EXPECT_STREQ(text.get(), kPosition.c_str());
  UniqueCStr huge(get_string_from_location(-1e308, 1e308));
  ASSERT_TRUE(huge);
  EXPECT_EQ(std::string(huge.get()).substr(0, 2), "-1");
}

TEST_F(LocationXmlTest, StoredFileVariants) {
  const std::string place = "<City>Suwon</City><Province>Gyeonggi-do</Province>";
  struct Case {
    const char* name;
    std::string content;
    int result;
    const char* city;
    const char* province;
    std::string logged;  // empty: not checked
  } cases[] = {
      {"same position", stored("<LatitudeLongitude>" + kPosition + "</LatitudeLongitude>" + place),
       0, "Suwon", "Gyeonggi-do", ""},
      {"another position",
       stored("<LatitudeLongitude>37.500001,127.000000</LatitudeLongitude>" + place), -1, "(none)",
       "(none)", "Longitude and latitude didn't match with previous"},
      {"city without province", stored("<City>Suwon</City>"), 0, "Suwon", "(none)", ""},
      {"position without text matches", stored("<LatitudeLongitude/><City/><Province>P</Province>"),
       0, "", "P", ""},
      {"other children skipped", stored("<Note>x</Note><City>C</City>"), 0, "C", "(none)", ""},
      {"wrong root", "<Place><City>C</City></Place>", 0, "(none)", "(none)",
       "Wrong XML data in  - " + stored_path_},
      {"not XML", "<Location>", -1, "(none)", "(none)", ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(write_file(stored_path_, c.content));
    LogCapture log;
    Args args(37.5, 127.0);
    EXPECT_EQ(get_city_and_province_from_stored(&args), c.result);
    EXPECT_EQ(args.city_text(), c.city);
    EXPECT_EQ(args.province_text(), c.province);
    if (!c.logged.empty()) {
      EXPECT_TRUE(log.contains(c.logged));
    }
  }
  std::remove(stored_path_.c_str());
  LogCapture log;
  EXPECT_EQ(get_city_and_province_from_stored(&args_), -1);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(LocationXmlTest, AnswerGivesLastCountyAndStateAndIsRemoved) {
  args_.city = strdup("stale");
  EXPECT_EQ(
      parse("<?xml version=\"1.0\"?><ns2:Search xmlns:ns2=\"http://www.navteq.com/lbsp/Search-"
            "Search/4\"><Response><View><Result><Location><Address>" +
            data("CountyName", "First County") + data("StateName", "First State") +
            data("Other", "x") + "</Address></Location></Result><Result><Location><Address>" +
            data("CountyName", "Second County") + "<Deeper>" + data("StateName", "Second State") +
            "</Deeper></Address></Location></Result></View></Response></ns2:Search>"),
      "0 Second County|Second State");
  EXPECT_FALSE(file_exists(answer_path_));
}

TEST_F(LocationXmlTest, AnswerWithoutCountyLeavesCityNone) {
  args_.city = strdup("stale");
  EXPECT_EQ(parse("<Search>" + data("StateName", "") + "</Search>"), "0 (none)|");
}

TEST_F(LocationXmlTest, ErrorAnswerGives18AndKeepsTheFile) {
  LogCapture log;
  EXPECT_EQ(parse("<ns2:Error xmlns:ns2=\"urn:x\" type=\"PermissionError\"/>"), "18 (none)|(none)");
  EXPECT_EQ(sds_last_error, 18);
  EXPECT_TRUE(log.contains("[CRITICAL] Here service returned error"));
  EXPECT_TRUE(file_exists(answer_path_));
}

TEST_F(LocationXmlTest, OtherAnswersLeaveCityAndProvinceAlone) {
  args_.city = strdup("kept");
  EXPECT_EQ(parse("<Unexpected>" + data("CountyName", "X") + "</Unexpected>"), "0 kept|(none)");
  EXPECT_TRUE(file_exists(answer_path_));

  LogCapture log;
  std::remove(answer_path_.c_str());
  EXPECT_EQ(sds_parse_city_and_province(&args_), 18);
  EXPECT_TRUE(log.contains("[CRITICAL] " + answer_path_ + " file not found"));
  EXPECT_EQ(args_.city_text(), "kept");
}

TEST_F(LocationXmlTest, ExternalEntityInAnswerDoesNotReadLocalFiles) {
  const std::string secret = root_.path("/secret.txt");
  ASSERT_TRUE(write_file(secret, "TOP-SECRET"));
  EXPECT_EQ(parse("<?xml version=\"1.0\"?>\n<!DOCTYPE Search [<!ENTITY leak SYSTEM \"file://" +
                  secret + "\">]>\n<Search>" + data("CountyName", "&leak;") +
                  data("StateName", "State &leak;") + "</Search>"),
            "0 |State ");
}

// An entity reference links to its declaration in the DTD; the walk must not
// follow that link out of the element tree and around again.
TEST_F(LocationXmlTest, EntityReferenceInAnswerDoesNotLoopTheWalk) {
  EXPECT_EQ(parse("<!DOCTYPE Search [<!ENTITY town \"Town\">]><Search>" +
                  data("CountyName", "&town;") + data("StateName", "S") + "</Search>"),
            "0 Town|S");
}

TEST_F(LocationXmlTest, EntityExpansionBombIsRefused) {
  std::string dtd = "<!DOCTYPE Search [<!ENTITY e0 \"aaaaaaaaaaaaaaaa\">";
  for (int level = 1; level <= 9; ++level) {
    dtd += "<!ENTITY e" + std::to_string(level) + " \"";
    for (int i = 0; i < 10; ++i) dtd += "&e" + std::to_string(level - 1) + ";";
    dtd += "\">";
  }
  EXPECT_EQ(parse(dtd + "]><Search>" + data("CountyName", "&e9;") + "</Search>"), "18 (none)|(none)");
}

TEST_F(LocationXmlTest, OversizeAnswerIsRefusedBeforeParsing) {
  LogCapture log;
  EXPECT_EQ(parse("<Search>" + data("CountyName", "C") + std::string(1024 * 1024, ' ') +
                  "</Search>"),
            "18 (none)|(none)");
  EXPECT_TRUE(log.contains("[CRITICAL] " + answer_path_ + " is larger than 1048576 bytes"));
}

// libxml2 refuses documents deeper than its own limit; anything it accepts is
// walked iteratively, to the deepest element.
TEST_F(LocationXmlTest, DeepAnswerIsWalkedWithoutRecursion) {
  std::string open, close;
  for (int i = 0; i < 250; ++i) {
    open += "<n>";
    close += "</n>";
  }
  EXPECT_EQ(parse("<Search>" + open + data("CountyName", "Deep") + close + data("StateName", "S") +
                  "</Search>"),
            "0 Deep|S");
}

TEST_F(LocationXmlTest, WalkCoversTheSiblingsOfTheStartNode) {
  EXPECT_EQ(parse("<Search><a>" + data("CountyName", "One") + "</a><b><c/>" +
                  data("CountyName", "Two") + "</b></Search>"),
            "0 Two|(none)");
}

TEST_F(LocationXmlTest, SaveWritesTheThreeElementsInOrder) {
  args_.city = strdup("Suwon & Co");
  args_.province = strdup("Gyeonggi-do");
  save_city_and_province(&args_);
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
  args_.city = strdup("Suwon");
  args_.province = strdup("");
  save_city_and_province(&args_);
  EXPECT_FALSE(file_exists(stored_path_));

  LogCapture log;
  std::free(args_.province);
  args_.province = strdup("P");
  ASSERT_EQ(std::system(("rm -rf '" + root_.dir() + SDS_SERVER_DIR + "'").c_str()), 0);
  save_city_and_province(&args_);
  EXPECT_TRUE(log.contains(
      "|xmlTextWriterEndDocument| failed. Couldn't save city and province information"));
}

}  // namespace
