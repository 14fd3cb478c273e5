#include <errno.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <memory>
#include <string>

#include "platform.h"

namespace {

constexpr char kVariable[] = "OSUTILS_TEST_VARIABLE";

struct FreeDeleter {
  void operator()(char* memory) const { free(memory); }
};
using Value = std::unique_ptr<char, FreeDeleter>;

class Environment : public testing::Test {
 protected:
  Environment() { unsetenv(kVariable); }
  ~Environment() override { unsetenv(kVariable); }
};

TEST_F(Environment, AnUnsetVariableIsNull) { EXPECT_EQ(ldap_getenv(kVariable), nullptr); }

TEST_F(Environment, ANullNameIsNull) { EXPECT_EQ(ldap_getenv(nullptr), nullptr); }

TEST_F(Environment, EachAnswerIsACopyOfItsOwn) {
  setenv(kVariable, "value", 1);
  const Value first(ldap_getenv(kVariable));
  const Value second(ldap_getenv(kVariable));
  ASSERT_STREQ(first.get(), "value");
  ASSERT_STREQ(second.get(), "value");
  EXPECT_NE(first.get(), second.get());

  first.get()[0] = 'V';
  EXPECT_STREQ(getenv(kVariable), "value");
}

TEST_F(Environment, AnEmptyValueIsNotUnset) {
  setenv(kVariable, "", 1);
  const Value value(ldap_getenv(kVariable));
  EXPECT_STREQ(value.get(), "");
}

TEST_F(Environment, KeepsTheVeryString) {
  std::string assignment = std::string(kVariable) + "=one";
  ASSERT_EQ(ldap_putenv(assignment.data()), 0);
  EXPECT_EQ(getenv(kVariable), assignment.data() + sizeof kVariable);

  assignment.back() = 'E';
  EXPECT_STREQ(getenv(kVariable), "onE");
  unsetenv(kVariable);  // before the string goes
}

TEST_F(Environment, TheValueMayHoldEqualSignsAndMayBeEmpty) {
  std::string equals = std::string(kVariable) + "=a=b";
  ASSERT_EQ(ldap_putenv(equals.data()), 0);
  EXPECT_STREQ(getenv(kVariable), "a=b");

  std::string empty = std::string(kVariable) + "=";
  ASSERT_EQ(ldap_putenv(empty.data()), 0);
  EXPECT_STREQ(getenv(kVariable), "");
  unsetenv(kVariable);
}

TEST_F(Environment, WithoutAnEqualSignNothingIsUnset) {
  setenv(kVariable, "kept", 1);
  std::string name = kVariable;
  errno = 0;
  EXPECT_EQ(ldap_putenv(name.data()), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_STREQ(getenv(kVariable), "kept");
}

TEST_F(Environment, AnEmptyNameIsRefused) {
  std::string assignment = "=value";
  errno = 0;
  EXPECT_EQ(ldap_putenv(assignment.data()), -1);
  EXPECT_EQ(errno, EINVAL);
  for (char** entry = environ; *entry != nullptr; ++entry) EXPECT_NE(*entry, assignment.data());
}

TEST_F(Environment, ANullOrEmptyAssignmentIsRefused) {
  std::string empty;
  for (char* const assignment : {static_cast<char*>(nullptr), empty.data()}) {
    errno = 0;
    EXPECT_EQ(ldap_putenv(assignment), -1);
    EXPECT_EQ(errno, EINVAL);
  }
}

TEST(LockSetting, TheFirstTimedLockConsultsTheEnvironment) {
  EXPECT_EQ(default_autolock, 1);
  EXPECT_EQ(configfile_read, 1);
  EXPECT_EQ(al_configfile_counter, 0);
}

}  // namespace
