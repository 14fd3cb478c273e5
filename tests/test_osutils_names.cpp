// The commands of the family "dn".
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;

// Runs `osutils dn COMMAND…` with a file as its standard input.
Result dnOf(Arguments arguments, const std::string& input) {
  arguments.insert(arguments.begin(), "dn");
  return osutils(std::move(arguments), [&] {
    const int descriptor = open(input.c_str(), O_RDONLY | O_CLOEXEC);
    if (dup2(descriptor, STDIN_FILENO) == -1) close(STDIN_FILENO);
  });
}

TEST_F(Tool, DnFormatShowsTheCanonicalSpelling) {
  expectAnswer(osutils({"dn", "format", "cn = Ann ,o=b"}),
               "NAME           FORMATTED\ncn = Ann ,o=b  CN=ANN,O=B\n");
  expectAnswer(osutils({"dn", "format", "--json", "[a,b]"}),
               R"({"name":"[a,b]","formatted":"[A,B]"})"
               "\n");
  expectFailure(osutils({"dn", "format", ""}),
                "osutils: dn format: parameter error (89): the name is empty\n");
}

TEST_F(Tool, DnFormatTakesTheLinesOfStandardInput) {
  const std::string names = temp.file("names", "a = b\nc=d;e=f");
  expectAnswer(dnOf({"format"}, names), "NAME     FORMATTED\na = b    A=B\nc=d;e=f  C=D,E=F\n");
  expectAnswer(dnOf({"format", "--json"}, temp.file("one", "a=b\n")),
               R"([{"name":"a=b","formatted":"A=B"}])"
               "\n");
  expectAnswer(dnOf({"format"}, "/dev/null"), "");
  expectAnswer(dnOf({"format", "--json"}, temp.path("closed")), "[]\n");
}

TEST_F(Tool, DnContinuesAfterALineThatIsNotAName) {
  const std::string bad = temp.file("bad", std::string("a=b\n\nx\0y\n \t\r\nA=b", 16));
  const auto lines = [](const std::string& command) {
    const std::string line = "osutils: dn " + command + ": line ";
    return line + "2 of standard input is blank\n" + line +
           "3 of standard input has a null character\n" + line + "4 of standard input is blank\n";
  };
  const Result formatted = dnOf({"format"}, bad);
  EXPECT_EQ(formatted.status, 3);
  EXPECT_EQ(formatted.out, "NAME  FORMATTED\na=b   A=B\nA=b   A=B\n");
  EXPECT_EQ(formatted.err, lines("format"));
  const Result compared = dnOf({"compare", "--json"}, bad);
  EXPECT_EQ(compared.status, 3);
  EXPECT_EQ(compared.out, "{\"a\":\"a=b\",\"b\":\"A=b\",\"equal\":true}\n");
  EXPECT_EQ(compared.err, lines("compare"));
  EXPECT_EQ(dnOf({"compare"}, temp.file("one", "a=b\n\n")).status, 3);
}

TEST_F(Tool, DnSaysThatEscapesOfTwoHexadecimalDigitsAreNotDecoded) {
  const auto line = [](const std::string& command, const std::string& name) {
    return "osutils: dn " + command + ": escapes of two hexadecimal digits are not decoded: \"" +
           name + "\"\n";
  };
  for (const std::string name : {R"(cn=a\2Cb)", R"(cn=a\\\e4b)", R"(cn=a\fF)"}) {
    SCOPED_TRACE(name);
    const Result result = osutils({"dn", "format", name});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, line("format", name));
    EXPECT_EQ(osutils({"dn", "format", "--quiet", name}).err, "");
    EXPECT_EQ(dnOf({"format"}, temp.file("names", name + "\na=b\n" + name)).err,
              line("format", name) + line("format", name));
    const Result compared = osutils({"dn", "compare", name, name});
    EXPECT_EQ(compared.status, 0);
    EXPECT_EQ(compared.err, line("compare", name) + line("compare", name));
    EXPECT_EQ(osutils({"dn", "compare", "--quiet", name, name}).err, "");
  }
  for (const std::string name : {R"(cn=a\,b)", R"(cn=a\\2Cb)", R"(cn=a\2)", R"(cn=a\2G)", "2C"}) {
    SCOPED_TRACE(name);
    EXPECT_EQ(osutils({"dn", "format", name}).err, "");
  }
}

TEST_F(Tool, DnKnowsWhatAHexadecimalDigitIs) {
  for (const std::string digit : {"0", "9", "a", "f", "A", "F"}) {
    EXPECT_NE(osutils({"dn", "format", "\\" + digit + "0"}).err, "") << digit;
    EXPECT_NE(osutils({"dn", "format", "cn=\\0" + digit}).err, "") << digit;
  }
  for (const std::string other : {"/", ":", "`", "g", "@", "G"}) {
    EXPECT_EQ(osutils({"dn", "format", "cn=\\" + other + "0"}).err, "") << other;
    EXPECT_EQ(osutils({"dn", "format", "cn=\\0" + other}).err, "") << other;
  }
  EXPECT_EQ(osutils({"dn", "format", R"(cn=\\\\00)"}).err, "");
}

TEST_F(Tool, DnHelpSaysWhatItDoesNotKnow) {
  for (const std::string command : {"format", "compare"}) {
    EXPECT_THAT(osutils({"dn", command, "--help"}).out,
                AllOf(HasSubstr("escapes of two hexadecimal digits"), HasSubstr("joined by \"+\""),
                      HasSubstr("synonyms"), HasSubstr("non-ASCII letters"), HasSubstr("--quiet")));
  }
  // The limits that the help names.
  for (const auto& [a, b] :
       {std::pair(R"(cn=a\2Cb)", R"(cn=a\,b)"), std::pair("cn=a+sn=b", "sn=b+cn=a"),
        std::pair("cn=a", "commonName=a"), std::pair("cn=\303\251", "cn=\303\211")}) {
    EXPECT_EQ(osutils({"dn", "compare", "--quiet", a, b}).status, 1) << a;
  }
}

TEST_F(Tool, DnCompareAnswersYesAndNo) {
  expectAnswer(osutils({"dn", "compare", "a=b", "A = B"}), "A    B      EQUAL\na=b  A = B  true\n");
  expectNo(osutils({"dn", "compare", "--json", "a=b", "a=c"}),
           R"({"a":"a=b","b":"a=c","equal":false})"
           "\n");
  expectFailure(osutils({"dn", "compare", "a=b"}),
                "osutils: dn compare: parameter error (89): B is missing\n");
  expectNo(osutils({"dn", "compare", "--json", "", ""}), R"({"a":"","b":"","equal":false})"
                                                         "\n");
}

TEST_F(Tool, DnCompareTakesTheTwoLinesOfStandardInput) {
  expectAnswer(dnOf({"compare", "--json"}, temp.file("two", "a=b\nA= b")),
               R"({"a":"a=b","b":"A= b","equal":true})"
               "\n");
  expectNo(dnOf({"compare"}, temp.file("other", "a=b\na=c\n")),
           "A    B    EQUAL\na=b  a=c  false\n");
  const std::string wrong[] = {"", "a=b\n", "a\nb\nc\n"};
  const std::string counts[] = {"0", "1", "3"};
  for (size_t i = 0; i < 3; ++i) {
    expectFailure(dnOf({"compare"}, temp.file("wrong", wrong[i])),
                  "osutils: dn compare: parameter error (89): two names are expected, not " +
                      counts[i] + "\n");
  }
}

TEST_F(Tool, DnReportsInputThatItCannotTake) {
  for (const std::string command : {"format", "compare"}) {
    SCOPED_TRACE(command);
    expectFailure(
        dnOf({command}, temp.path()),
        "osutils: dn " + command + ": operations error (1): cannot read standard input\n");
  }
}

}  // namespace
