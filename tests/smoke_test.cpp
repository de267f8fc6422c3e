#include <gtest/gtest.h>

#include "serve/sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"
#include "support/temp_root.h"

TEST(Paths, RootIsPrefixedOnlyWhenSet) {
  {
    TempRoot root;
    EXPECT_EQ(sds_path(SDS_DB_PATH), root.dir() + SDS_DB_PATH);
  }
  unsetenv("SITEDECK_ROOT");
  EXPECT_EQ(sds_path(SDS_DB_PATH), std::string(SDS_DB_PATH));
  setenv("SITEDECK_ROOT", "", 1);
  EXPECT_EQ(sds_path(SDS_DB_PATH), std::string(SDS_DB_PATH));
  unsetenv("SITEDECK_ROOT");
}

TEST(ErrorString, NamesAndUnknowns) {
  struct Case {
    int code;
    const char* name;
  } cases[] = {{0, "SDS_ERROR_NONE"}, {1, "SDS_ERROR_IO_ERROR"}, {2, "SDS_ERROR_UNKNOWN"},
               {-1, "SDS_ERROR_UNKNOWN"}, {18, "SDS_ERROR_SERVER_REQUEST_FAILED"},
               {15, "SDS_ERROR_UNKNOWN"}, {9, "SDS_ERROR_UNKNOWN"}, {14, "SDS_ERROR_NO_SPACE"}};
  for (const auto& c : cases) EXPECT_STREQ(sds_error_string(c.code), c.name) << c.code;
}
