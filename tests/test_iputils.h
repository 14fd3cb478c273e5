// Fixture of the tests of addresses.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "faults.h"
#include "osutils.h"
#include "private_network.h"
#include "world.h"

constexpr char kHostName[] = "thishost";
constexpr char kNoSocket[] = "Error getting size of interface :: Bad file descriptor\n";
constexpr char kBlank[] = "D isValidIPAddressOnSystem: passed an NULL or blank IP address\n";

#define REQUIRE_NETWORK() REQUIRE_ROOT("for a network, a host name and an /etc of its own")

// ---- Network ----

// Runs the body in a child process with the host name kHostName, with this file as /etc/hosts, and
// with a private network that has no address.
inline void withNetwork(std::string_view hosts, const std::function<void()>& body) {
  EXPECT_EQ(withPrivateNetwork([&] {
              require(sethostname(kHostName, strlen(kHostName)) == 0, "sethostname");
              writeFile("/etc/host.conf", "multi on\n");
              writeFile("/etc/hosts", hosts);
              body();
              return 0;
            }),
            0);
}

// Makes gethostbyname() fail, whose result the library ignores, so that it sends no query to a real
// name server.
class NoNameLookUp {
 private:
  FailingCall look_up_{Call::gethostbyname, ENOENT, 1, 1000};
};

// ---- Lists ----

inline char* untouched_entries[] = {nullptr};
inline char** const kUntouched = untouched_entries;

// The outputs of one call. The list is copied to `texts` and freed.
struct Answer {
  int rc;
  int count;
  bool untouched;  // whether the list is unchanged
  std::vector<std::string> texts;
};

inline Answer taken(int rc, char** list, int count) {
  Answer answer = {rc, count, list == kUntouched, {}};
  if (answer.untouched) return answer;
  if (list == nullptr) {
    ADD_FAILURE() << "a null list";
    return answer;
  }
  for (char** entry = list; *entry != nullptr; ++entry) {
    answer.texts.push_back(*entry);
    free(*entry);
  }
  EXPECT_EQ(answer.texts.size(), static_cast<size_t>(count));
  list[count + 1] = nullptr;  // there is room for one more
  free(static_cast<void*>(list));
  return answer;
}

// The two functions that differ only in the name that they look up.
struct Lister {
  const char* name;
  int (*list)(char***, int*);
  const char* host;
};
inline const Lister kListers[] = {{"getAllIPAddresses", getAllIPAddresses, kHostName},
                                  {"getLocalHostIPAddress", getLocalHostIPAddress, "localhost"}};

inline Answer call(const Lister& lister) {
  char** list = kUntouched;
  int count = 4711;
  const int rc = lister.list(&list, &count);
  return taken(rc, list, count);
}

inline void expectList(const Answer& answer, const std::vector<std::string>& texts) {
  EXPECT_EQ(answer.rc, 0);
  EXPECT_EQ(answer.count, static_cast<int>(texts.size()));
  EXPECT_THAT(answer.texts, testing::ElementsAreArray(texts));
}

inline void expectNoList(const Answer& answer, int rc) {
  EXPECT_EQ(answer.rc, rc);
  EXPECT_EQ(answer.count, 0);
  EXPECT_TRUE(answer.untouched);
}

inline std::string resolverText(const char* function, int code) {
  return "D getAllIPAddresses: " + std::string(function) + " failed with error " +
         std::to_string(code) + ": " + gai_strerror(code) + "\n";
}

inline std::string left(const std::string& name, int code) {
  return (code == 0 ? "< " : "<! ") + name + " " + std::to_string(code);
}

inline int unlessSanitized(int blocks) { return sanitizerOwnsMalloc() ? 0 : blocks; }

// A hosts file with these addresses for both names.
inline std::string hostsOf(const std::vector<std::string>& addresses) {
  std::string hosts;
  for (const Lister& lister : kListers) {
    for (const std::string& address : addresses) hosts += address + " " + lister.host + "\n";
  }
  return hosts;
}

// Adds 10.9.0.1 and so on, each as a separate record ("lo:1" and so on).
inline std::vector<std::string> addAliases(int number) {
  std::vector<std::string> addresses;
  for (int i = 1; i <= number; ++i) {
    addresses.push_back("10.9.0." + std::to_string(i));
    addAddress("lo:" + std::to_string(i), addresses.back());
  }
  return addresses;
}
