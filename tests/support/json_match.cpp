#include "support/json_match.h"

#include <memory>

namespace {

struct JsonParserFree {
  void operator()(JsonParser* parser) const { g_object_unref(parser); }
};
using UniqueJsonParser = std::unique_ptr<JsonParser, JsonParserFree>;

}  // namespace

::testing::AssertionResult IsJson(const std::string& text, const std::string& expected,
                                  const std::function<bool(JsonNode* printed)>& settle) {
  UniqueJsonParser got(json_parser_new()), want(json_parser_new());
  if (!json_parser_load_from_data(got.get(), text.c_str(), -1, nullptr) ||
      !json_parser_load_from_data(want.get(), expected.c_str(), -1, nullptr)) {
    return ::testing::AssertionFailure() << "not JSON: " << text;
  }
  if (settle && !settle(json_parser_get_root(got.get()))) {
    return ::testing::AssertionFailure() << "printed " << text;
  }
  if (!json_node_equal(json_parser_get_root(got.get()), json_parser_get_root(want.get()))) {
    return ::testing::AssertionFailure() << "printed " << text;
  }
  return ::testing::AssertionSuccess();
}
