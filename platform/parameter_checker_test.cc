#include <gtest/gtest.h>

#include "zeph/json_file.h"
#include "zeph/parameter_checker.h"

namespace {

Json::Value Parse(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(ZEPH::JsonParse(text, v)) << text;
  return v;
}

Json::Value Rule(int type, bool necessary) {
  Json::Value rules;
  rules["field"]["p"]["type"] = type;
  rules["field"]["p"]["necessary"] = necessary;
  return rules;
}

// One row: a type code, a parameter value (JSON text) and whether it fits.
struct Case {
  int type;
  const char* value;
  bool fits;
};

TEST(ParameterChecker, TypeCodes) {
  const Case cases[] = {
      {4, "\"text\"", true},  {4, "\"\"", true},     {4, "5", false},
      {4, "true", false},     {4, "null", false},    {4, "[\"a\"]", false},
      {5, "true", true},      {5, "false", true},    {5, "\"true\"", false},
      {5, "1", false},        {8, "[]", true},       {8, "[\"a\", \"b\"]", true},
      {8, "[\"a\", 1]", false}, {8, "\"a\"", false}, {8, "{}", false},
      {13, "[]", true},       {13, "[{\"a\": 1}]", true},
      {13, "[5, {}]", true},  // elements are the worker's to judge
      {13, "{}", false},      {13, "\"x\"", false},
      {15, "5", true},        {15, "-3", true},      {15, "0", true},
      {15, "5.0", false},     {15, "5.5", false},    {15, "\"5\"", false},
      {15, "4294967296", false}, {15, "true", false},
      {99, "\"text\"", false},
  };
  for (const Case& c : cases) {
    Json::Value params;
    params["p"] = Parse(c.value);
    ZEPH::APIRequest request(params);
    EXPECT_EQ(ParameterChecker::check(&request, Rule(c.type, true)), c.fits)
        << "type " << c.type << " value " << c.value;
    EXPECT_EQ(ParameterChecker::check(&request, Rule(c.type, false)), c.fits)
        << "type " << c.type << " value " << c.value << " (optional)";
  }
}

TEST(ParameterChecker, NecessaryAndOptionalParameters) {
  ZEPH::APIRequest empty;
  EXPECT_FALSE(ParameterChecker::check(&empty, Rule(4, true)));
  EXPECT_TRUE(ParameterChecker::check(&empty, Rule(4, false)));

  Json::Value rules = Rule(4, true);
  rules["field"]["q"]["type"] = 5;
  rules["field"]["q"]["necessary"] = false;
  ZEPH::APIRequest ok(Parse("{\"p\": \"x\", \"extra\": 1}"));
  EXPECT_TRUE(ParameterChecker::check(&ok, rules));
  ZEPH::APIRequest bad(Parse("{\"p\": \"x\", \"q\": \"yes\"}"));
  EXPECT_FALSE(ParameterChecker::check(&bad, rules));

  // Malformed rule objects never pass.
  for (const char* r : {"null", "{}", "{\"field\": []}",
                        "{\"field\": {\"p\": {\"type\": \"4\", \"necessary\": true}}}",
                        "{\"field\": {\"p\": {\"type\": 4, \"necessary\": 1}}}"}) {
    EXPECT_FALSE(ParameterChecker::check(&ok, Parse(r))) << r;
  }
  EXPECT_FALSE(ParameterChecker::check(nullptr, rules));
}

}  // namespace
