// The canonical spelling of distinguished names, and the name of the platform.

#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <stdlib.h>
#include <string.h>

#include <array>
#include <memory>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <string_view>
#include <tuple>
#include <vector>

#include "dn_model.h"
#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

struct FreeText {
  void operator()(char* text) const { free(text); }
};
using Text = std::unique_ptr<char, FreeText>;

// The text in a buffer of exactly its size, so that a sanitizer detects reads beyond it.
std::vector<char> exactly(std::string_view text) {
  std::vector<char> buffer(text.begin(), text.end());
  buffer.push_back('\0');
  buffer.shrink_to_fit();
  return buffer;
}

std::optional<std::string> formatted(std::string_view dn) {
  std::vector<char> name = exactly(dn);
  const std::vector<char> before = name;
  const Text canonical(formatDn(name.data()));
  EXPECT_EQ(name, before) << "the caller's name was changed";
  if (!canonical) return std::nullopt;
  return canonical.get();
}

struct Spelling {
  const char* name;
  const char* canonical;
};

void expectSpellings(std::initializer_list<Spelling> spellings) {
  for (const Spelling& spelling : spellings) {
    SCOPED_TRACE(spelling.name);
    EXPECT_EQ(formatted(spelling.name), spelling.canonical);
  }
}

bool areEqual(std::string_view a, std::string_view b) {
  return compareDns(exactly(a).data(), exactly(b).data());
}

// ---- Whole names ----

TEST(FormatDn, UnifiesBlanksSeparatorsAndCase) {
  expectSpellings({{"cn = John Smith , o = Example ; c=US", "CN=JOHN SMITH,O=EXAMPLE,C=US"},
                   {"\n cn\n=\nJohn\nSmith\n,\no=Example", "CN=JOHN\nSMITH,O=EXAMPLE"},
                   {"CN=JOHN SMITH,O=EXAMPLE,C=US", "CN=JOHN SMITH,O=EXAMPLE,C=US"}});
}

TEST(FormatDn, KeepsTheQuotesOfAValueAndDropsWhatFollowsThem) {
  expectSpellings(
      {{"cn=\"a, b\" ,o=x", "CN=\"A, B\",O=X"}, {"cn=\"a, b\" and more ,o=x", "CN=\"A, B\",O=X"}});
}

TEST(FormatDn, FormatsEveryPartOfAMultiValuedName) {
  expectSpellings({{"cn=a + sn=b", "CN=A+SN=B"}, {"cn=a+sn=b , o=c", "CN=A+SN=B,O=C"}});
}

TEST(FormatDn, GivesAnEmptyTextForANameOfBlanks) {
  expectSpellings({{" ", ""}, {"\n", ""}, {" \n \n", ""}});
}

// ---- State by state ----

TEST(FormatDn, SkipsBlanksBeforeAType) {
  expectSpellings({{"  \n\n cn=a", "CN=A"}, {"cn=a, \n o=b", "CN=A,O=B"}});
}

TEST(FormatDn, BeginsATypeWithAnythingButABlank) {
  expectSpellings({{"=a", "=A"},
                   {"==a", "==A"},
                   {",=a", ",=A"},
                   {";=a", ";=A"},
                   {"+=a", "+=A"},
                   {"\"=a", "\"=A"},
                   {"\\=a", "\\=A"},
                   {"\t=a", "\t=A"},
                   {"\r=a", "\r=A"},
                   {"cn=a,,=b", "CN=A,,=B"}});
}

TEST(FormatDn, EndsATypeOnlyAtAnEqualsSign) {
  expectSpellings({{"cn", "CN"},
                   {"c,n", "C,N"},
                   {"c,n=a", "C,N=A"},
                   {"c;n=a", "C;N=A"},
                   {"c+n=a", "C+N=A"},
                   {"c\"n=a", "C\"N=A"},
                   {"c\tn=a", "C\tN=A"},
                   {"c\rn=a", "C\rN=A"}});
}

TEST(FormatDn, EscapesNothingInAType) {
  expectSpellings({{"cn\\=a", "CN\\=A"},
                   {"cn\\=,a", "CN\\=,A"},
                   {"c\\ n=a", "C\\N=A"},
                   {"c\\+n=a", "C\\+N=A"},
                   {"c \\+n \\=a", "C\\+N\\=A"}});
}

TEST(FormatDn, JoinsTheWordsOfAType) {
  expectSpellings({{"common name=a", "COMMONNAME=A"},
                   {"a b\nc =d", "ABC=D"},
                   {"cn \n =a", "CN=A"},
                   {"c ,n=a", "C,N=A"},
                   {"c ;n=a", "C;N=A"},
                   {"c +n=a", "C+N=A"},
                   {"c \"n=a", "C\"N=A"},
                   {"c \tn=a", "C\tN=A"},
                   {"c \rn=a", "C\rN=A"},
                   {"c ", "C"}});
}

TEST(FormatDn, SkipsBlanksBeforeAValue) {
  expectSpellings(
      {{"cn= \n a", "CN=A"}, {"cn= \n \"a\"", "CN=\"A\""}, {"cn= \n ", "CN="}, {"cn=", "CN="}});
}

TEST(FormatDn, BeginsAValueWithAnythingButABlank) {
  expectSpellings({{"cn==a", "CN==A"},
                   {"cn=,a", "CN=,A"},
                   {"cn=;a", "CN=;A"},
                   {"cn=+a", "CN=+A"},
                   {"cn=;;b=c", "CN=;,B=C"},
                   {"cn=\ta", "CN=\tA"},
                   {"cn=\ra", "CN=\rA"}});
}

TEST(FormatDn, KeepsAllButSeparatorsInAnUnquotedValue) {
  expectSpellings({{"cn=a=b", "CN=A=B"},
                   {"cn=a\"b\"", "CN=A\"B\""},
                   {"cn=a  b\n\nc", "CN=A  B\n\nC"},
                   {"cn=a\tb\rc", "CN=A\tB\rC"}});
}

TEST(FormatDn, RemovesBlanksBeforeASeparatorButNoOtherWhiteSpace) {
  expectSpellings({{"cn=a \n ,o=b", "CN=A,O=B"},
                   {"cn=a \n ;o=b", "CN=A,O=B"},
                   {"cn=a \n +o=b", "CN=A+O=B"},
                   {"cn=a\t,o=b", "CN=A\t,O=B"},
                   {"cn=a\r\n,o=b", "CN=A\r,O=B"},
                   {"cn=a\t ,o=b", "CN=A\t,O=B"}});
}

TEST(FormatDn, KeepsEverythingBetweenQuotes) {
  expectSpellings({{"cn=\" a,b;c+d=e\nf\tg\rh \",o=x", "CN=\" A,B;C+D=E\nF\tG\rH \",O=X"},
                   {"cn=\"\",o=x", "CN=\"\",O=X"},
                   {"cn=\"a", "CN=\"A"},
                   {"cn=\"", "CN=\""}});
}

TEST(FormatDn, DropsEverythingBetweenTheClosingQuoteAndASeparator) {
  expectSpellings({{"cn=\"a\"b", "CN=\"A\""},
                   {"cn=\"a\"=\"b\" \n\t\r\\,o=x", "CN=\"A\",O=X"},
                   {"cn=\"a\" \\\\+o=x", "CN=\"A\"+O=X"}});
}

TEST(FormatDn, KeepsASemicolonOnlyAfterAQuotedValue) {
  expectSpellings({{"cn=\"a\";o=x", "CN=\"A\";O=X"},
                   {"cn=\"a\" ; o=x", "CN=\"A\";O=X"},
                   {"cn=\"a\",o=x", "CN=\"A\",O=X"},
                   {"cn=\"a\"+o=x", "CN=\"A\"+O=X"},
                   {"cn=a;o=x", "CN=A,O=X"}});
}

// ---- Escapes in values ----

TEST(FormatDn, KeepsTheBackslashOfFourCharactersInAnUnquotedValue) {
  expectSpellings({{"cn=a\\,b", "CN=A\\,B"},
                   {"cn=a\\=b", "CN=A\\=B"},
                   {"cn=a\\\"b", "CN=A\\\"B"},
                   {"cn=a\\\\b", "CN=A\\\\B"}});
}

TEST(FormatDn, DropsTheBackslashOfAllOthersInAnUnquotedValue) {
  expectSpellings({{"cn=a\\+b", "CN=A+B"},
                   {"cn=a\\;b", "CN=A;B"},
                   {"cn=a\\bc", "CN=ABC"},
                   {"cn=a\\ b", "CN=A B"},
                   {"cn=a\\\nb", "CN=A\nB"},
                   {"cn=a\\\tb", "CN=A\tB"},
                   {"cn=a\\\rb", "CN=A\rB"}});
}

TEST(FormatDn, TreatsEscapesInAQuotedValueLikewise) {
  expectSpellings({{"cn=\"a\\,b\"", "CN=\"A\\,B\""},
                   {"cn=\"a\\=b\"", "CN=\"A\\=B\""},
                   {"cn=\"a\\\"b\"", "CN=\"A\\\"B\""},
                   {"cn=\"a\\\\\"b", "CN=\"A\\\\\""},
                   {"cn=\"a\\+b\"", "CN=\"A+B\""},
                   {"cn=\"a\\;b\"", "CN=\"A;B\""},
                   {"cn=\"a\\bc\"", "CN=\"ABC\""},
                   {"cn=\"a\\ b\"", "CN=\"A B\""},
                   {"cn=\"a\\\nb\"", "CN=\"A\nB\""},
                   {"cn=\"a\\\tb\"", "CN=\"A\tB\""},
                   {"cn=\"a\\\rb\"", "CN=\"A\rB\""}});
}

TEST(FormatDn, TakesABackslashAtTheBeginningOfAValueForAnEscape) {
  expectSpellings({{"cn=\\,a", "CN=\\,A"},
                   {"cn=\\;a,o=b", "CN=;A,O=B"},
                   {"cn=\\\"a,b\"", "CN=\\\"A,B\""},
                   {"cn=\\\\,o=b", "CN=\\\\,O=B"}});
}

TEST(FormatDn, PairsBackslashesFromTheLeft) {
  expectSpellings({{"cn=a\\\\,o=b", "CN=A\\\\,O=B"},
                   {"cn=a\\\\\\,o=b", "CN=A\\\\\\,O=B"},
                   {"cn=a\\\\+o=b", "CN=A\\\\+O=B"},
                   {"cn=a\\\\\\+o=b", "CN=A\\\\+O=B"}});
}

TEST(FormatDn, KeepsABackslashThatEndsTheName) {
  expectSpellings({{"\\", "\\"},
                   {"cn\\", "CN\\"},
                   {"cn=\\", "CN=\\"},
                   {"cn=a\\", "CN=A\\"},
                   {"cn=\"a\\", "CN=\"A\\"},
                   {"cn=\"a\"\\", "CN=\"A\""}});
}

TEST(FormatDn, KeepsAnEscapedBlankAfterTheEqualsSign) {
  expectSpellings({{"cn=\\ a", "CN= A"}, {"cn= \\  a", "CN=  A"}, {"cn=\\\na", "CN=\nA"}});
}

TEST(FormatDn, RemovesAnEscapedBlankBeforeASeparator) {
  expectSpellings(
      {{"cn=a\\ ,o=b", "CN=A,O=B"}, {"cn=\\ ,o=b", "CN=,O=B"}, {"cn=\\\n+o=b", "CN=+O=B"}});
}

// ---- The end of a name ----

TEST(FormatDn, RemovesWhiteSpaceOfAnySortAtTheEnd) {
  expectSpellings({{"cn=a ", "CN=A"},
                   {"cn=a \t\n\v\f\r ", "CN=A"},
                   {"cn=\"a \t", "CN=\"A"},
                   {"cn\t\r", "CN"},
                   {"\t", ""},
                   {"\v\f", ""}});
}

TEST(FormatDn, RemovesAnEscapedBlankAtTheEnd) {
  expectSpellings(
      {{"cn=a\\ ", "CN=A"}, {"cn=a\\  ", "CN=A"}, {"cn=a\\\n", "CN=A"}, {"cn=a\\\t", "CN=A"}});
}

TEST(FormatDn, KeepsOneWhiteSpaceAfterABackslashAtTheEnd) {
  expectSpellings({{"cn=a\\\\ ", "CN=A\\\\ "},
                   {"cn=a\\\\  ", "CN=A\\\\ "},
                   {"cn=a\\\\\t\r\n", "CN=A\\\\\t"},
                   {"cn=\"a\\\\ ", "CN=\"A\\\\ "},
                   {"cn\\\t", "CN\\\t"},
                   {"\\\t", "\\\t"}});
}

// ---- Upper case ----

TEST(FormatDn, RaisesAsciiLettersAndNothingElse) {
  std::string value, raised;
  for (int byte = 1; byte < 256; ++byte) {
    const char c = static_cast<char>(byte);
    if (strchr(",;+\\", c) != nullptr) continue;
    value += c;
    raised += c >= 'a' && c <= 'z' ? static_cast<char>(c - 0x20) : c;
  }

  EXPECT_EQ(formatted("cn=x" + value + "x"), "CN=X" + raised + "X");
}

TEST(FormatDn, RaisesEveryLetterOfANameOfAnyLength) {
  for (size_t length = 1; length <= 100; ++length) {
    SCOPED_TRACE(length);
    EXPECT_EQ(formatted(std::string(length, 'z')), std::string(length, 'Z'));
  }
}

// ---- No name, no memory ----

// A character that lost its backslash may be a separator in the new name.
TEST(FormatDn, MayChangeASpellingOfItsOwn) {
  EXPECT_EQ(formatted(R"(cn=a\;b)"), "CN=A;B");
  EXPECT_EQ(formatted("CN=A;B"), "CN=A,B");
}

TEST(FormatDn, GivesNothingForANullPointer) {
  const Records records;

  EXPECT_EQ(formatDn(nullptr), nullptr);

  EXPECT_THAT(records.trail(), ElementsAre("> formatDn", "< formatDn 0"));
}

TEST(FormatDn, GivesNothingForAnEmptyName) {
  const Records records;

  EXPECT_EQ(formatted(""), std::nullopt);

  EXPECT_THAT(records.trail(), ElementsAre("> formatDn", "< formatDn 0"));
}

TEST(FormatDn, GivesNothingWithoutMemoryAndSaysNothing) {
  REQUIRE_OWN_MALLOC();
  std::vector<char> name = exactly("cn=a");
  const Records records;
  const LiveAllocations allocations;
  const FailingCall allocation(Call::allocation, ENOMEM);

  EXPECT_EQ(formatDn(name.data()), nullptr);

  ASSERT_TRUE(allocation.fired());
  EXPECT_EQ(allocations.blocks(), 0);
  EXPECT_THAT(records.trail(), ElementsAre("> formatDn", "< formatDn 0"));
}

TEST(FormatDn, AllocatesNothingButItsResult) {
  REQUIRE_OWN_MALLOC();
  std::vector<char> name = exactly("cn=a");
  const LiveAllocations allocations;
  const FailingCall counter(Call::allocation, ENOMEM, 1000);

  Text canonical(formatDn(name.data()));

  EXPECT_EQ(counter.calls(), 1);
  EXPECT_EQ(allocations.blocks(), 1);
  canonical.reset();
  EXPECT_EQ(allocations.blocks(), 0);
}

// With such a buffer a sanitizer detects every write beyond the name's own size.
TEST(FormatDn, WorksInABufferOfTheSizeOfTheName) {
  if (!sanitizerOwnsMalloc()) GTEST_SKIP() << "only a sanitizer's malloc knows sizes exactly";
  std::vector<char> name = exactly("cn = a");

  const Text canonical(formatDn(name.data()));

  EXPECT_EQ(malloc_usable_size(canonical.get()), name.size());
}

// ---- Records ----

TEST(FormatDn, TracesAnEmptyPairOfQuotesWhateverTheName) {
  std::vector<char> name = exactly("cn=a \t ");
  const Records records;

  const Text canonical(formatDn(name.data()));

  EXPECT_STREQ(canonical.get(), "CN=A");
  EXPECT_THAT(records.trail(), ElementsAre("> formatDn", "D formatDn \"\"\n", "< formatDn 0"));
}

TEST(FormatDn, RecordsAreOfItsOwnNumberAndClass) {
  const Records records(kEntryExit33);

  EXPECT_EQ(formatted("cn=a"), "CN=A");

  ASSERT_EQ(records.all().size(), 2U);
  for (const Record& record : records.all()) EXPECT_EQ(record.id & ~0xFFUL, 0x3E0D0100UL);
}

TEST(FormatDn, LeavesNoRecordsOfTheOtherClass) {
  const Records records(kEntryExit43 | kExitError43);

  EXPECT_EQ(formatted("cn=a"), "CN=A");

  EXPECT_THAT(records.all(), IsEmpty());
}

// ---- Against an independent model ----

constexpr std::string_view kAlphabet = "a=,;+\"\\ \t\n\r";

// Records which characters each of the formatter's seven states has met:
//   0 before a type     1 in a type     2 after a blank in a type     3 before a value
//   4 in an unquoted value     5 in a quoted value     6 after the closing quote
class StateCoverage {
 public:
  // State, whether the character is escaped, and the character.
  using Step = std::tuple<int, bool, char>;

  void step(char c) {
    covered_[static_cast<size_t>(state_)][is_escaped_][static_cast<unsigned char>(c)] = true;
    state_ = next(c);
    is_escaped_ = c == '\\' && !is_escaped_;
  }

  void restart() {
    state_ = 0;
    is_escaped_ = false;
  }

  std::set<Step> covered() const {
    std::set<Step> steps;
    for (int state = 0; state < kStates; ++state) {
      for (const bool is_escaped : {false, true}) {
        for (int byte = 0; byte < 256; ++byte) {
          if (!covered_[static_cast<size_t>(state)][is_escaped][static_cast<size_t>(byte)])
            continue;
          steps.emplace(state, is_escaped, static_cast<char>(byte));
        }
      }
    }
    return steps;
  }

 private:
  static constexpr int kStates = 7;

  int next(char c) const {
    const bool is_blank = c == ' ' || c == '\n';
    const bool is_separator = c == ',' || c == ';' || c == '+';
    switch (state_) {
      case 0:
        return is_blank ? 0 : 1;
      case 1:
        return c == '=' ? 3 : is_blank ? 2 : 1;
      case 2:
        return c == '=' ? 3 : 2;
      case 3:
        return c == '"' ? 5 : is_blank ? 3 : 4;
      case 4:
        return is_separator && !is_escaped_ ? 0 : 4;
      case 5:
        return c == '"' && !is_escaped_ ? 6 : 5;
      default:
        return is_separator ? 0 : 6;
    }
  }

  int state_ = 0;
  bool is_escaped_ = false;
  std::array<std::array<std::array<bool, 256>, 2>, kStates> covered_{};
};

// Every state with every character. No character is escaped in states 0 and 3: these begin after a
// separator or "=", and a backslash leaves them.
std::set<StateCoverage::Step> allSteps() {
  std::set<StateCoverage::Step> steps;
  for (int state = 0; state <= 6; ++state) {
    for (const char c : kAlphabet) {
      steps.emplace(state, false, c);
      if (state != 0 && state != 3) steps.emplace(state, true, c);
    }
  }
  return steps;
}

TEST(FormatDn, AgreesWithTheModelOnAMillionRandomNames) {
  std::mt19937 random(20260101);  // the same names each time
  StateCoverage coverage;
  std::string name;
  for (int i = 0; i < 1'000'000; ++i) {
    name.resize(1 + random() % 32);
    coverage.restart();
    for (char& c : name) {
      c = kAlphabet[random() % kAlphabet.size()];
      coverage.step(c);
    }
    const Text canonical(formatDn(name.data()));
    ASSERT_NE(canonical, nullptr);
    ASSERT_EQ(canonical.get(), modelOfFormattedDn(name)) << testing::PrintToString(name);
  }

  EXPECT_EQ(coverage.covered(), allSteps());
}

TEST(FormatDn, AgreesWithTheModelOnEveryByteInEveryPlace) {
  for (const std::string before :
       {"", "c", "c ", "c=", "c=a", "c=\"", "c=\"a\"", "c=\\", "c=\"\\"}) {
    for (const std::string after : {"", "b", " ,o=c", "\\ "}) {
      for (int byte = 1; byte < 256; ++byte) {
        const std::string name = before + static_cast<char>(byte) + after;
        ASSERT_EQ(formatted(name), modelOfFormattedDn(name)) << testing::PrintToString(name);
      }
    }
  }
}

std::string repeated(std::string_view text, int times) {
  std::string all;
  for (int i = 0; i < times; ++i) all += text;
  return all;
}

TEST(FormatDn, AgreesWithTheModelOnLongNames) {
  constexpr int kTimes = 30'000;
  for (const std::string_view part : {" ", "\t", "x", "\\", "\"", "=", ",", "\\,", "\\ ", "\\+",
                                      "\\\\", "a = b ; ", "a=\"b\" c ;", "a\n"}) {
    for (const char* const before : {"", "cn=", "cn=a", "cn=\"", "cn=\"a\""}) {
      for (const char* const after : {"", ",o=b"}) {
        SCOPED_TRACE(before + testing::PrintToString(std::string(part)) + " again and again" +
                     after);
        const std::string name = before + repeated(part, kTimes) + after;
        // Not EXPECT_EQ, which would print both texts.
        EXPECT_TRUE(formatted(name) == modelOfFormattedDn(name));
      }
    }
  }
}

// ---- compareDns ----

TEST(CompareDns, TakesTwoSpellingsOfOneNameForEqual) {
  EXPECT_TRUE(areEqual("cn=a,o=b", "CN = A ; O = B"));
  EXPECT_TRUE(areEqual("cn=a\\+o=b", "cn=a+o=b"));
  EXPECT_TRUE(areEqual(" ", "\t"));  // both are formatted as an empty string
}

TEST(CompareDns, TellsNamesApart) {
  EXPECT_FALSE(areEqual("cn=a,o=b", "cn=a,o=c"));
  EXPECT_FALSE(areEqual("cn=\"a\";o=b", "cn=\"a\",o=b"));
  EXPECT_FALSE(areEqual("cn=a\\,o=b", "cn=a,o=b"));
}

TEST(CompareDns, KnowsNoHexadecimalEscapesNoOrderNoSynonymsAndNoOtherLetters) {
  EXPECT_FALSE(areEqual("cn=\\41", "cn=A"));
  EXPECT_TRUE(areEqual("cn=\\41", "cn=41"));
  EXPECT_FALSE(areEqual("cn=a\\,b", "cn=a\\2Cb"));
  EXPECT_FALSE(areEqual("cn=a+sn=b", "sn=b+cn=a"));
  EXPECT_FALSE(areEqual("cn=a", "commonName=a"));
  EXPECT_FALSE(areEqual("cn=a", "2.5.4.3=a"));
  EXPECT_FALSE(areEqual("cn=\xC3\xA9", "cn=\xC3\x89"));  // e and E with an acute accent
}

TEST(CompareDns, TellsANameFromItsBeginning) {
  EXPECT_FALSE(areEqual("cn=a,o=bc", "cn=a,o=b"));
  EXPECT_FALSE(areEqual("cn=a,o=b", "cn=a,o=bc"));
  EXPECT_FALSE(areEqual("cn=a", " "));
  EXPECT_FALSE(areEqual(" ", "cn=a"));
}

TEST(CompareDns, IsFalseForANullOrEmptyName) {
  std::vector<char> name = exactly("cn=a");
  std::vector<char> empty = exactly("");
  EXPECT_FALSE(compareDns(nullptr, name.data()));
  EXPECT_FALSE(compareDns(name.data(), nullptr));
  EXPECT_FALSE(compareDns(nullptr, nullptr));
  EXPECT_FALSE(compareDns(empty.data(), name.data()));
  EXPECT_FALSE(compareDns(name.data(), empty.data()));
  EXPECT_FALSE(compareDns(empty.data(), empty.data()));
}

TEST(CompareDns, LeavesTheNamesAsTheyAre) {
  std::vector<char> a = exactly("cn = a");
  std::vector<char> b = exactly("CN=A ");

  EXPECT_TRUE(compareDns(a.data(), b.data()));

  EXPECT_EQ(a, exactly("cn = a"));
  EXPECT_EQ(b, exactly("CN=A "));
}

TEST(CompareDns, LeavesOnlyTheRecordsOfTheTwoFormattings) {
  const Records records;

  EXPECT_TRUE(areEqual("cn=a", "cn=a"));

  EXPECT_THAT(records.trail(), ElementsAre("> formatDn", "D formatDn \"\"\n", "< formatDn 0",  //
                                           "> formatDn", "D formatDn \"\"\n", "< formatDn 0"));
}

TEST(CompareDns, FormatsBothNamesEvenWhenTheFirstIsNull) {
  std::vector<char> name = exactly("cn=a");
  const Records records;

  EXPECT_FALSE(compareDns(nullptr, name.data()));

  EXPECT_THAT(records.trail(), ElementsAre("> formatDn", "< formatDn 0",  //
                                           "> formatDn", "D formatDn \"\"\n", "< formatDn 0"));
}

TEST(CompareDns, FreesWhatItFormats) {
  REQUIRE_OWN_MALLOC();
  std::vector<char> a = exactly("cn=a");
  std::vector<char> b = exactly("cn=b");
  const LiveAllocations allocations;

  EXPECT_TRUE(compareDns(a.data(), a.data()));
  EXPECT_FALSE(compareDns(a.data(), b.data()));
  EXPECT_FALSE(compareDns(a.data(), nullptr));
  EXPECT_FALSE(compareDns(nullptr, b.data()));

  EXPECT_EQ(allocations.blocks(), 0);
}

TEST(CompareDns, IsFalseWithoutMemoryForEitherName) {
  REQUIRE_OWN_MALLOC();
  std::vector<char> name = exactly("cn=a");
  const LiveAllocations allocations;
  for (int nth = 1;; ++nth) {
    SCOPED_TRACE(nth);
    FailingCall allocation(Call::allocation, ENOMEM, nth);
    const bool equal = compareDns(name.data(), name.data());
    allocation.disarm();
    EXPECT_EQ(allocations.blocks(), 0);
    EXPECT_EQ(equal, !allocation.fired());
    if (!allocation.fired()) {
      EXPECT_EQ(nth, 3);  // one for each name
      break;
    }
  }
}

// ---- getOSname ----

TEST(GetOSname, IsOneTextForGood) {
  const char* const name = getOSname();

  EXPECT_STREQ(name, "Linux-x64");
  EXPECT_EQ(getOSname(), name);
}

TEST(GetOSname, LeavesNoTrace) {
  const Records records;

  EXPECT_NE(getOSname(), nullptr);

  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

}  // namespace
