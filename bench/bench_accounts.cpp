// An account look-up compared with the C library's own, in a database of 20 accounts.
#include <benchmark/benchmark.h>
#include <nss.h>
#include <pwd.h>

#include <string>

#include "ldtr.h"
#include "osutils.h"
#include "private_etc.h"
#include "unavailable.h"

namespace {

constexpr int kAccounts = 20;
constexpr const char kName[] = "account12";
constexpr int kUid = 2012;

// Both sides read the file themselves: no name service daemon, no other database.
std::string usePrivateAccounts() {
  std::string accounts = "root:x:0:0:root:/root:/bin/sh\n";
  for (int number = 1; number < kAccounts; ++number) {
    const std::string text = std::to_string(number);
    accounts += "account" + text + ":x:" + std::to_string(2000 + number) + ":100:Account " + text +
                ":/home/account" + text + ":/bin/sh\n";
  }
  if (__nss_configure_lookup("passwd", "files") != 0) return "cannot select the account database";
  return writeToPrivateEtc("passwd", accounts);
}

void lookUp(benchmark::State& state, int (*uidOf)(const char*)) {
  static const std::string why_not = usePrivateAccounts();
  if (!why_not.empty()) return unavailable(state, why_not);
  if (uidOf(kName) != kUid) return state.SkipWithError("wrong uid");
  trcEvents = 0;
  for (auto _ : state) {
    int uid = uidOf(kName);
    benchmark::DoNotOptimize(uid);
  }
}

int plainLookUp(const char* name) {
  const passwd* const account = getpwnam(name);
  return account == nullptr ? -99 : static_cast<int>(account->pw_uid);
}

BENCHMARK_CAPTURE(lookUp, vra_getpwnam_uid, vra_getpwnam_uid)->Name("account/vra_getpwnam_uid");
BENCHMARK_CAPTURE(lookUp, getpwnam, plainLookUp)->Name("account/getpwnam");

}  // namespace
