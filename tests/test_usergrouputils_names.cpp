#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "osutils.h"
#include "records.h"
#include "test_usergrouputils.h"

using testing::ElementsAre;

namespace {

constexpr char kEmptyName[] = "isValidName: Passed a NULL or empty name.\n";
constexpr char kLength[] = "isValidName: Error: Length violation.\n";
constexpr char kRange[] = "isValidName: Error: Character range violation.\n";
constexpr char kLetter[] = "isValidName: Error: Not starting with a letter.\n";
constexpr char kPrefix[] = "isValidName: Error: Cannot start with ORX, SYS or SQL.\n";
constexpr char kReserved[] =
    "isValidName: Error: Cannot be anyone of Users, Admins, guests, public and local.\n";

// Expects that the name is refused with the message, or accepted if `message` is null.
void expectName(const char* name, const char* message) {
  SCOPED_TRACE(name != nullptr ? testing::PrintToString(name) : "null");
  std::string copy = name != nullptr ? name : "";
  const Records records;

  EXPECT_EQ(isValidName(name != nullptr ? copy.data() : nullptr), message == nullptr);

  if (message == nullptr) {
    EXPECT_THAT(records.trail(), ElementsAre("> isValidName", "<! isValidName 1"));
  } else {
    EXPECT_THAT(records.trail(),
                ElementsAre("> isValidName", std::string("D ") + message, "< isValidName 0"));
  }
  EXPECT_EQ(copy, name != nullptr ? name : "");
}

TEST(ValidName, HasOneToEightCharacters) {
  expectName(nullptr, kEmptyName);
  expectName("", kEmptyName);
  expectName("a", nullptr);
  expectName("Z", nullptr);
  expectName("a1234567", nullptr);
  expectName("a12345678", kLength);
  expectName("public_or_private", kLength);
}

TEST(ValidName, TooLongIsThatWhateverElseIsWrongWithIt) {
  expectName("1-$%&/()=", kLength);
  expectName("sysadmins", kLength);
  expectName("\xc3\xa4\xc3\xb6\xc3\xbc\xc3\x9f\xc3", kLength);
}

TEST(ValidName, BeginsWithALetter) {
  expectName("1abc", kLetter);
  expectName("_abc", kLetter);
  expectName("0", kLetter);
  expectName("_", kLetter);
  expectName("$abc", kRange);   // the range is checked first
  expectName("1ab-", kLetter);  // but only that of the first character
}

TEST(ValidName, OfEveryTwoBytesHasALetterADigitOrAnUnderscoreAfterALetter) {
  for (int byte = 1; byte < 256; ++byte) {
    const bool is_letter = (byte >= 'A' && byte <= 'Z') || (byte >= 'a' && byte <= 'z');
    const bool in_range = is_letter || (byte >= '0' && byte <= '9') || byte == '_';
    const char behind[] = {'x', static_cast<char>(byte), '\0'};
    const char alone[] = {static_cast<char>(byte), '\0'};
    expectName(behind, in_range ? nullptr : kRange);
    expectName(alone, is_letter ? nullptr : in_range ? kLetter : kRange);
  }
}

TEST(ValidName, IsLookedAtToItsLastCharacter) {
  expectName("a-b", kRange);
  expectName("abcdefg-", kRange);
  expectName("abcdefg\xe9", kRange);
  expectName("sys-", kRange);  // checked before the reserved words
}

TEST(ValidName, DoesNotBeginWithAReservedPrefixInAnyCase) {
  for (const char* const name :
       {"orx", "ORX", "Orxdb", "sql", "sqlx", "sQL1", "sys", "SYStem", "system_1"}) {
    expectName(name, kPrefix);
  }
  for (const char* const name : {"or", "sq", "sy", "orz", "sqx", "syx", "aorx", "asql", "asys",
                                 "s_ys", "osys", "ors", "sqs"}) {
    expectName(name, nullptr);
  }
}

TEST(ValidName, IsNotAReservedWordInAnyCase) {
  for (const char* const name : {"Users", "users", "USERS", "Admins", "admins", "ADMINS", "guests",
                                 "Guests", "public", "PUBLIC", "local", "LoCaL"}) {
    expectName(name, kReserved);
  }
  for (const char* const name :
       {"user", "Userss", "User", "admin", "Adminss", "guest", "guestss", "publi", "publics",
        "loca", "locals", "locale", "auser", "alocal", "apublic"}) {
    expectName(name, nullptr);
  }
}

}  // namespace
