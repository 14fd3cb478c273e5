// Loading the services file compared with the C library's own loop over it, and the search for a free
// port.
#include <benchmark/benchmark.h>
#include <netdb.h>
#include <nss.h>

#include <string>

#include "ldtr.h"
#include "osutils.h"
#include "private_etc.h"
#include "unavailable.h"

namespace {

// Lines like those of a real services file: names of several lengths, some with aliases and comments.
std::string servicesFile(int lines) {
  std::string content;
  for (int line = 0; line < lines; ++line) {
    const std::string number = std::to_string(line);
    content += line % 3 == 0 ? "svc" + number : "service-" + number;
    content += "\t\t" + std::to_string(1 + line % 65535) + (line % 2 == 0 ? "/tcp" : "/udp");
    if (line % 4 == 0) content += "\talias" + number;
    if (line % 5 == 0) content += "\t\t# a service of the benchmark";
    content += '\n';
  }
  return content;
}

// Gives /etc/services so many lines. Returns an empty string, or why that failed.
std::string useServicesFile(int lines) {
  static int in_use = 0;
  static std::string why_not;
  if (lines != in_use) {
    in_use = lines;
    why_not = __nss_configure_lookup("services", "files") != 0
                  ? "cannot select the services database"
                  : writeToPrivateEtc("services", servicesFile(lines));
  }
  return why_not;
}

void readEtcServicesAndFree(benchmark::State& state) {
  const int lines = static_cast<int>(state.range(0));
  if (const std::string why_not = useServicesFile(lines); !why_not.empty()) {
    return unavailable(state, why_not);
  }
  trcEvents = 0;
  VRAOSUtils::EtcServices services;
  const std::string last = (lines - 1) % 3 == 0 ? "svc" : "service-";
  if (services.readEtcServices() != OSUTILS_SUCCESS ||
      !services.doesServiceExist((last + std::to_string(lines - 1)).c_str())) {
    return state.SkipWithError("the services file was not loaded");
  }
  services.freeServicesEntries();
  for (auto _ : state) {
    int rc = services.readEtcServices();
    benchmark::DoNotOptimize(rc);
    services.freeServicesEntries();
  }
}

void getserventLoop(benchmark::State& state) {
  const int lines = static_cast<int>(state.range(0));
  if (const std::string why_not = useServicesFile(lines); !why_not.empty()) {
    return unavailable(state, why_not);
  }
  for (auto _ : state) {
    int count = 0;
    setservent(0);
    while (getservent() != nullptr) ++count;
    endservent();
    if (count != lines) state.SkipWithError("getservent() did not read every line");
  }
}

// All ports that a TCP service can have are taken.
void findAvaliablePort(benchmark::State& state) {
  constexpr int kPorts = 65'535;
  if (const std::string why_not = useServicesFile(kPorts); !why_not.empty()) {
    return unavailable(state, why_not);
  }
  trcEvents = 0;
  VRAOSUtils::EtcServices services;
  if (services.readEtcServices() != OSUTILS_SUCCESS ||
      services.findAvaliablePort(1) != kPorts + 1) {
    return state.SkipWithError("not every port is taken");
  }
  for (auto _ : state) {
    int port = services.findAvaliablePort(1);
    benchmark::DoNotOptimize(port);
  }
}
BENCHMARK(findAvaliablePort)->Name("ports/findAvaliablePort")->Unit(benchmark::kMicrosecond);

void sizes(benchmark::internal::Benchmark* benchmark) {
  benchmark->Arg(300)->Arg(12'000)->Arg(1'000'000)->Unit(benchmark::kMicrosecond);
}
BENCHMARK(readEtcServicesAndFree)->Name("services/readEtcServices")->Apply(sizes);
BENCHMARK(getserventLoop)->Name("services/getservent")->Apply(sizes);

}  // namespace
