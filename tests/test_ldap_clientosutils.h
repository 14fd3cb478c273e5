// Fixture of the tests of the resolver wrappers.
#pragma once

#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <netinet/in.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "ldap_clientosutils.h"
#include "records.h"
#include "world.h"

constexpr unsigned int kErrorLevel = 0xC8110000;

#define REQUIRE_HOSTS() REQUIRE_ROOT("for a private /etc with its own hosts")

// Sets the platform's debug switch until the end of the scope.
class DebugSwitch {
 public:
  explicit DebugSwitch(int answer) { readLdapDebugAnswer = answer; }
  ~DebugSwitch() { readLdapDebugAnswer = 0; }
  DebugSwitch(const DebugSwitch&) = delete;
  DebugSwitch& operator=(const DebugSwitch&) = delete;
};

// Expects one print of this text at the error level, and no trace record.
inline void expectPrint(const Records& records, const std::string& text) {
  EXPECT_THAT(records.all(), testing::IsEmpty());
  EXPECT_THAT(records.prints(),
              testing::ElementsAre(AllOf(testing::Field(&Print::level, kErrorLevel),
                                         testing::Field(&Print::text, text))));
}

inline void expectNothingWritten(const Records& records) {
  EXPECT_THAT(records.all(), testing::IsEmpty());
  EXPECT_THAT(records.prints(), testing::IsEmpty());
}

// Runs the body in a child process for which only these hosts and one service exist.
inline void withHosts(std::string_view hosts, const std::function<void()>& body) {
  EXPECT_EQ(withPrivateEtc([&] {
              writeFile("/etc/hosts", hosts);
              writeFile("/etc/services", "post 25/tcp\n");
              body();
              return 0;
            }),
            0);
}

inline sockaddr_in socketAddress(const char* address, uint16_t port) {
  sockaddr_in made = {};
  made.sin_family = AF_INET;
  made.sin_port = htons(port);
  EXPECT_EQ(inet_pton(AF_INET, address, &made.sin_addr), 1);
  return made;
}

struct NameAnswer {
  int rc;
  std::string host;
  std::string serv;
};

inline char untouched_text[] = "untouched";

inline std::string taken(char* text) {
  if (text == nullptr) return "(null)";
  std::string copy = text;
  if (text != untouched_text) free(text);
  return copy;
}

inline NameAnswer nameInfo(const sockaddr_in& address, bool with_host = true,
                           bool with_serv = true) {
  char* host = untouched_text;
  char* serv = untouched_text;
  const int rc = vra_getnameinfo(reinterpret_cast<const sockaddr*>(&address), sizeof address,
                                 with_host ? &host : nullptr, with_serv ? &serv : nullptr);
  return {rc, taken(host), taken(serv)};
}

struct FreeBlock {
  void operator()(hostent* block) const { free(block); }
};

struct HostAnswer {
  int rc;
  std::unique_ptr<hostent, FreeBlock> entry;
  int size;
};

inline hostent untouched_entry;

inline HostAnswer byName(const char* name) {
  hostent* entry = &untouched_entry;
  int size = 4711;
  const int rc = vra_gethostbyname(name, &entry, &size);
  EXPECT_NE(entry, &untouched_entry);
  return {rc, std::unique_ptr<hostent, FreeBlock>(entry), size};
}
