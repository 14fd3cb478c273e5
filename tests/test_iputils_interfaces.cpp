#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <net/if.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "faults.h"
#include "ldtr.h"
#include "osutils.h"
#include "records.h"
#include "test_iputils.h"
#include "world.h"

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

Answer callLinux() {
  char** list = kUntouched;
  int count = 4711;
  ifconf scratch;
  const int rc = getAllIPAddresses_Linux(&list, &count, &scratch);
  return taken(rc, list, count);
}

void expectFailureOfLinux(const Answer& answer) {
  EXPECT_EQ(answer.rc, -1);
  EXPECT_EQ(answer.count, 4711);
  EXPECT_TRUE(answer.untouched);
}

// ---- getAllIPAddresses_Linux ----

TEST(InterfaceList, WithoutInterfacesIsEmpty) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    const Records records;
    const LiveAllocations live;
    expectList(callLinux(), {});
    EXPECT_EQ(live.blocks(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAre("> getAllIPAddresses_Linux", "< getAllIPAddresses_Linux 0"));
  });
}

TEST(InterfaceList, CountsTheLoopbackWithoutItsAddress) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    startLoopback();
    expectList(callLinux(), {""});
  });
}

TEST(InterfaceList, OfALoopbackAndOneMoreInterface) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    startLoopback();
    addAddress("eth0", "192.0.2.17");
    expectList(callLinux(), {"", "192.0.2.17"});
  });
}

TEST(InterfaceList, TakesOnlyTheVeryNameForTheLoopback) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    addAddress("lo:1", "10.9.0.1");
    addAddress("l", "10.9.0.2");
    addAddress("lo", "10.9.0.3");
    addAddress("lo0", "10.9.0.4");
    addAddress("LO", "127.0.0.5");
    addAddress("lo", "127.0.0.6");
    addAddress("fifteen-letters", "255.255.255.254");
    expectList(callLinux(),
               {"10.9.0.1", "10.9.0.2", "", "10.9.0.4", "127.0.0.5", "", "255.255.255.254"});
  });
}

TEST(InterfaceList, HasAtMostTenOfTheRecords) {
  REQUIRE_NETWORK();
  for (const int records : {2, 9, 10, 11, 25, 30}) {
    SCOPED_TRACE(records);
    withNetwork("", [records] {
      startLoopback();
      std::vector<std::string> expected = addAliases(records - 1);
      expected.insert(expected.begin(), "");
      if (expected.size() > 10) expected.resize(10);
      const LiveAllocations live;

      expectList(callLinux(), expected);

      EXPECT_EQ(live.blocks(), 0);
    });
  }
}

// The buffer of 1024 bytes holds 25 records of 40 bytes; the library does not ask again for more.
TEST(InterfaceList, IsAskedForOnceInARoomForTwentyFiveRecords) {
  REQUIRE_NETWORK();
  for (const int records : {10, 24, 25, 26, 30}) {
    SCOPED_TRACE(records);
    withNetwork("", [records] {
      addAliases(records);
      char** list = kUntouched;
      int count = 4711;
      ifconf scratch = {};
      const FailingCall requests(Call::ioctl, 0, kNever);

      const int rc = getAllIPAddresses_Linux(&list, &count, &scratch);

      EXPECT_EQ(taken(rc, list, count).texts.size(), 10U);
      EXPECT_EQ(requests.calls(), 1);
      EXPECT_EQ(scratch.ifc_len, std::min(records, 25) * 40);
      EXPECT_EQ(scratch.ifc_buf, nullptr);
    });
  }
}

TEST(InterfaceList, IsMadeOfOneArrayAndItsStrings) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    startLoopback();
    addAliases(2);
    const LiveAllocations live;
    char** list = nullptr;
    int count = 0;
    ifconf scratch;

    ASSERT_EQ(getAllIPAddresses_Linux(&list, &count, &scratch), 0);

    EXPECT_EQ(live.blocks(), unlessSanitized(4));
    EXPECT_EQ(list[3], nullptr);
    taken(0, list, count);
  });
}

TEST(InterfaceList, LeavesASocketOpen) {
  REQUIRE_NETWORK();
  withNetwork("", [] {
    const int before = openDescriptors();
    callLinux();
    callLinux();
    EXPECT_EQ(openDescriptors(), before + 2);
  });
}

TEST(InterfaceList, KeepsNoPointerIntoTheFunction) {
  char** list = kUntouched;
  int count = 4711;
  char old[] = "old";
  ifconf scratch = {};
  scratch.ifc_buf = old;
  const FailingCall request(Call::ioctl, EBADF);
  testing::internal::CaptureStderr();
  EXPECT_EQ(getAllIPAddresses_Linux(&list, &count, &scratch), -1);
  testing::internal::GetCapturedStderr();
  EXPECT_EQ(scratch.ifc_buf, nullptr);
}

TEST(InterfaceList, ThatCannotBeReadFailsWithATextOnStandardError) {
  EXPECT_EQ(inChild([] {  // in a child, because the socket stays open
              const Records records;
              const LiveAllocations live;
              const int before = openDescriptors();
              const FailingCall request(Call::ioctl, EPERM);
              testing::internal::CaptureStderr();

              const Answer answer = callLinux();

              EXPECT_EQ(testing::internal::GetCapturedStderr(),
                        "Error getting size of interface :: Operation not permitted\n");
              EXPECT_TRUE(request.fired());
              EXPECT_EQ(request.calls(), 1);
              expectFailureOfLinux(answer);
              EXPECT_EQ(openDescriptors(), before + 1);
              EXPECT_EQ(live.blocks(), 0);
              EXPECT_THAT(records.trail(), ElementsAre("> getAllIPAddresses_Linux",
                                                       "<! getAllIPAddresses_Linux -1"));
              return 0;
            }),
            0);
}

TEST(InterfaceList, WithoutASocketCannotBeReadEither) {
  const int before = openDescriptors();
  const FailingCall no_socket(Call::socket, EAFNOSUPPORT);
  testing::internal::CaptureStderr();

  const Answer answer = callLinux();

  EXPECT_EQ(testing::internal::GetCapturedStderr(), kNoSocket);  // tracing is off: always written
  EXPECT_TRUE(no_socket.fired());
  expectFailureOfLinux(answer);
  EXPECT_EQ(openDescriptors(), before);
}

TEST(InterfaceList, WithoutMemoryFailsAndKeepsNothingButTheSocket) {
  REQUIRE_NETWORK();
  REQUIRE_OWN_MALLOC();
  withNetwork("", [] {
    startLoopback();
    addAliases(1);
    for (int nth = 1;; ++nth) {
      SCOPED_TRACE(nth);
      const Records records;
      const LiveAllocations live;
      const int before = openDescriptors();
      FailingCall allocation(Call::allocation, ENOMEM, nth);
      testing::internal::CaptureStderr();
      const Answer answer = callLinux();
      EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
      allocation.disarm();
      EXPECT_EQ(live.blocks(), 0);
      EXPECT_EQ(openDescriptors(), before + 1);
      if (!allocation.fired()) {
        EXPECT_EQ(answer.rc, 0);
        EXPECT_EQ(nth, 4);  // the array and two texts have failed
        break;
      }
      expectFailureOfLinux(answer);
      EXPECT_THAT(records.trail(),
                  ElementsAre("> getAllIPAddresses_Linux", "<! getAllIPAddresses_Linux -1"));
    }
  });
}

// ---- getAllIPAddresses_TVX ----

TEST(GetAllIPAddressesTVX, AnswersZeroThroughTheGlobalScopeAndLeavesNoRecord) {
  const Records records;
  const LiveAllocations live;
  const int before = openDescriptors();
  ldtr_fun.SetErrorCode(4711);

  EXPECT_EQ(getAllIPAddresses_TVX(), 0);

  long code;
  memcpy(&code, static_cast<const void*>(&ldtr_fun), sizeof code);
  EXPECT_EQ(code, 0);
  EXPECT_THAT(records.trail(), IsEmpty());
  EXPECT_EQ(live.blocks(), 0);
  EXPECT_EQ(openDescriptors(), before);
}

}  // namespace
