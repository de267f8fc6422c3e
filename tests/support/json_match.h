// Comparing what a program printed as JSON with the document a test expects.
#pragma once

#include <gtest/gtest.h>
#include <json-glib/json-glib.h>

#include <functional>
#include <string>

// Whether `text` is the JSON document `expected`: the same members with the
// same values and types, in any order. `settle`, when given, sees the printed
// document first and may pin values that vary from run to run (after checking
// them); returning false fails the match.
::testing::AssertionResult IsJson(const std::string& text, const std::string& expected,
                                  const std::function<bool(JsonNode* printed)>& settle = {});
