// The commands "name check", "screen" and "time".
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <nlohmann/json.hpp>
#include <regex>
#include <string>

#include "tool.h"
#include "world.h"

namespace {

TEST(Checks, NameCheckAnswersYesAndNo) {
  expectAnswer(osutils({"name", "check", "inst_1"}), "NAME    VALID\ninst_1  true\n");
  for (const std::string name : {"", "1inst", "inst12345", "in-st", "SQLdb", "public"}) {
    SCOPED_TRACE(name);
    expectNo(osutils({"name", "check", "--json", name}),
             R"({"name":")" + name + R"(","valid":false})" + "\n");
  }
}

TEST(Checks, ScreenAnswersForEachTextAndFailsForOne) {
  expectAnswer(osutils({"screen", "plain", "two words", "#", ""}),
               "TEXT       PASSES\nplain      true\ntwo words  true\n#          true\n"
               "           true\n");
  expectNo(osutils({"screen", "--json", "plain", "a;b", "time"}),
           R"([{"text":"plain","passes":true},{"text":"a;b","passes":false},)"
           R"({"text":"time","passes":true}])"
           "\n");
}

TEST(Checks, ScreenTakesEveryTextAsItStands) {
  for (const std::string text :
       {"[]", "[a]", "[a,b]", "{}", "a;b", "[", "a]", "$x", "a\\b", "a\nb"}) {
    SCOPED_TRACE(text);
    const Result result = osutils({"screen", "--json", text});
    EXPECT_EQ(result.status, 1);
    EXPECT_EQ(nlohmann::json::parse(result.out),
              nlohmann::json::array({{{"text", text}, {"passes", false}}}));
  }
  expectAnswer(
      osutils({"screen", "%%", "a,b", "screen", "--", "-x", "--json", "--", "--help"}),
      "TEXT    PASSES\n%%      true\na,b     true\nscreen  true\n--      true\n-x      true\n"
      "--json  true\n--      true\n--help  true\n");
}

TEST(Checks, ScreenTakesManyTexts) {
  Arguments arguments(2001, "text");
  arguments.front() = "screen";
  const Result result = osutils(arguments);
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(std::count(result.out.begin(), result.out.end(), '\n'), 2001);
}

TEST(Checks, TimeShowsTheStampInTheZoneOfTheEnvironment) {
  const auto in = [](const char* zone) { return [zone] { setenv("TZ", zone, 1); }; };
  const Result full = osutils({"time"}, in("EST5"));
  EXPECT_EQ(full.status, 0);
  EXPECT_TRUE(std::regex_match(
      full.out, std::regex(R"(TIME\n\d{4}-\d\d-\d\d-\d\d:\d\d:\d\d\.\d{3}-05:00\n)")))
      << full.out;
  const Result compact = osutils({"time", "--compact", "--json"}, in("UTC0"));
  EXPECT_EQ(compact.status, 0);
  EXPECT_TRUE(
      std::regex_match(compact.out, std::regex(R"(\{"time":"\d{4}y\d\dy\d\dy\d\dy\d\dy\d\d"\}\n)")))
      << compact.out;
}

}  // namespace
