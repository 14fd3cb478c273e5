#include <arpa/inet.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

#include "faults.h"
#include "ldap_clientosutils.h"
#include "records.h"
#include "test_ldap_clientosutils.h"
#include "world.h"

namespace {

void expectAnswer(const NameAnswer& answer, int rc, const std::string& host,
                  const std::string& serv) {
  EXPECT_EQ(answer.rc, rc);
  EXPECT_EQ(answer.host, host);
  EXPECT_EQ(answer.serv, serv);
}

// ---- vra_getnameinfo ----

TEST(GetNameInfo, RefusesANullAddressAnEmptyOneAndNoOutputs) {
  const Records records;
  const DebugSwitch debug(1);
  const sockaddr_in address = socketAddress("10.0.0.1", 25);
  const auto* const generic = reinterpret_cast<const sockaddr*>(&address);
  char* host = untouched_text;
  char* serv = untouched_text;

  EXPECT_EQ(vra_getnameinfo(nullptr, sizeof address, &host, &serv), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_getnameinfo(generic, 0, &host, &serv), OSUTILS_PARAM_ERROR);
  EXPECT_EQ(vra_getnameinfo(generic, sizeof address, nullptr, nullptr), OSUTILS_PARAM_ERROR);

  EXPECT_EQ(host, untouched_text);
  EXPECT_EQ(serv, untouched_text);
  expectNothingWritten(records);
}

TEST(GetNameInfo, GivesTheHostAndTheServiceByName) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server alias\n", [] {
    const Records records;
    const DebugSwitch debug(1);
    const LiveAllocations live;

    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_SUCCESS, "server", "post");

    EXPECT_EQ(live.blocks(), 0);  // the caller freed both
    expectNothingWritten(records);
  });
}

TEST(GetNameInfo, GivesNumbersForWhatHasNoName) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server\n", [] {
    expectAnswer(nameInfo(socketAddress("10.0.0.2", 26)), OSUTILS_SUCCESS, "10.0.0.2", "26");
  });
}

TEST(GetNameInfo, GivesTheHostAlone) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server\n", [] {
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), true, false), OSUTILS_SUCCESS, "server",
                 "untouched");
  });
}

TEST(GetNameInfo, GivesTheServiceAlone) {
  REQUIRE_HOSTS();
  withHosts("10.0.0.1 server\n", [] {
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), false, true), OSUTILS_SUCCESS, "untouched",
                 "post");
  });
}

TEST(GetNameInfo, TakesAnAddressOfTheOtherFamily) {
  REQUIRE_HOSTS();
  withHosts("2001:db8::1 six\n", [] {
    sockaddr_in6 address = {};
    address.sin6_family = AF_INET6;
    address.sin6_port = htons(25);
    ASSERT_EQ(inet_pton(AF_INET6, "2001:db8::1", &address.sin6_addr), 1);
    char* host = nullptr;

    EXPECT_EQ(vra_getnameinfo(reinterpret_cast<const sockaddr*>(&address), sizeof address, &host,
                              nullptr),
              OSUTILS_SUCCESS);

    EXPECT_EQ(taken(host), "six");
  });
}

TEST(GetNameInfo, HasRoomForAHostNameOf1024Characters) {
  REQUIRE_HOSTS();
  const std::string longest(1024, 'h');
  withHosts("10.0.0.1 " + longest + "\n10.0.0.2 " + longest + "h\n", [&] {
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_SUCCESS, longest, "post");
    expectAnswer(nameInfo(socketAddress("10.0.0.2", 25)), OSUTILS_OPERATIONS_ERROR, "(null)",
                 "(null)");
  });
}

TEST(GetNameInfo, HasRoomForAServiceNameOf31Characters) {
  REQUIRE_HOSTS();
  const std::string longest(31, 's');
  withHosts("10.0.0.1 server\n", [&] {
    writeFile("/etc/services", longest + " 25/tcp\n" + longest + "s 26/tcp\n");
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_SUCCESS, "server", longest);
    expectAnswer(nameInfo(socketAddress("10.0.0.1", 26)), OSUTILS_OPERATIONS_ERROR, "(null)",
                 "(null)");
  });
}

TEST(GetNameInfo, PrintsErrnoAndNotTheAnswerOfAFailedLookUp) {
  const Records records;
  const DebugSwitch debug(1);
  const LiveAllocations live;
  const FailingCall look_up(Call::getnameinfo, EAI_FAIL);
  errno = 1234;

  expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_OPERATIONS_ERROR, "(null)",
               "(null)");

  EXPECT_TRUE(look_up.fired());
  EXPECT_EQ(live.blocks(), 0);
  expectPrint(records, "vra_getnameinfo: getnameinfo failed with errno 1234\n");
}

TEST(GetNameInfo, FailsForAnAddressThatIsTooShort) {
  const DebugSwitch debug(0);
  const Records records;
  const LiveAllocations live;
  const sockaddr_in address = socketAddress("10.0.0.1", 25);
  char* host = untouched_text;
  char* serv = untouched_text;

  EXPECT_EQ(vra_getnameinfo(reinterpret_cast<const sockaddr*>(&address), 1, &host, &serv),
            OSUTILS_OPERATIONS_ERROR);

  EXPECT_EQ(host, nullptr);
  EXPECT_EQ(serv, nullptr);
  EXPECT_EQ(live.blocks(), 0);
  expectNothingWritten(records);  // the switch is off
}

TEST(GetNameInfo, FailsWithOneOutputAlone) {
  const DebugSwitch debug(1);
  const LiveAllocations live;
  for (const bool with_host : {true, false}) {
    SCOPED_TRACE(with_host);
    const Records records;
    const FailingCall look_up(Call::getnameinfo, EAI_AGAIN);
    errno = 7;

    expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), with_host, !with_host),
                 OSUTILS_OPERATIONS_ERROR, with_host ? "(null)" : "untouched",
                 with_host ? "untouched" : "(null)");

    expectPrint(records, "vra_getnameinfo: getnameinfo failed with errno 7\n");
  }
  EXPECT_EQ(live.blocks(), 0);
}

// Expects that nothing is looked up, printed or left allocated when this allocation fails.
void expectNoMemory(int nth, const std::string& host, const std::string& service) {
  const Records records;
  const DebugSwitch debug(1);
  const LiveAllocations live;
  const FailingCall look_up(Call::getnameinfo, EAI_FAIL);
  const FailingCall allocation(Call::allocation, ENOMEM, nth);

  expectAnswer(nameInfo(socketAddress("10.0.0.1", 25)), OSUTILS_NO_MEMORY, host, service);

  EXPECT_TRUE(allocation.fired());
  EXPECT_EQ(look_up.calls(), 0);
  EXPECT_EQ(live.blocks(), 0);
  expectNothingWritten(records);
}

TEST(GetNameInfo, WithoutMemoryForTheHost) {
  REQUIRE_OWN_MALLOC();
  expectNoMemory(1, "(null)", "untouched");
}

TEST(GetNameInfo, WithoutMemoryForTheServiceReleasesTheHost) {
  REQUIRE_OWN_MALLOC();
  expectNoMemory(2, "(null)", "(null)");
}

TEST(GetNameInfo, WithoutMemoryForTheServiceAlone) {
  REQUIRE_OWN_MALLOC();
  const LiveAllocations live;
  const FailingCall allocation(Call::allocation, ENOMEM, 1);

  expectAnswer(nameInfo(socketAddress("10.0.0.1", 25), false, true), OSUTILS_NO_MEMORY, "untouched",
               "(null)");

  EXPECT_TRUE(allocation.fired());
  EXPECT_EQ(live.blocks(), 0);
}

}  // namespace
