// soak off|on CALLS [LEAK]: makes that many calls of all exported functions in several threads, with
// tracing off or with everything traced and printed. Each function must leave exactly the memory and
// the descriptors that docs/compatibility.md lists, and the process must not grow otherwise. Prints
// tables, and exits with 1 after a finding. Needs root, and is to be run by tests/apart.
//
// The trace moves between two directories and the file of debug messages is emptied, so that both
// stay small. LEAK, "block" or "descriptor", makes getOSname leave one in every 100th call of a
// thread, which must be found.

#include <cxxabi.h>
#include <dirent.h>
#include <dlfcn.h>
#include <ldtr.h>
#include <malloc.h>
#include <osutils.h>
#include <pwd.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <barrier>
#include <filesystem>
#include <fstream>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "calls_of_threads.h"
#include "live_blocks.h"
#include "platform.h"
#include "world.h"

namespace {

constexpr size_t kThreads = 4;
constexpr int kRounds = 50;
constexpr int kWarmUpRounds = 5;
constexpr long kResidentBound = 512;  // KiB, beyond what live blocks explain

// What each call of a function leaves.
struct Left {
  long blocks = 0;
  long descriptors = 0;
};

struct Totals {
  long calls = 0;
  long wrong = 0;
  long blocks = 0;  // that the calls left
  Totals& operator+=(const Totals& other) {
    calls += other.calls;
    wrong += other.wrong;
    blocks += other.blocks;
    return *this;
  }
};

bool is(const ExportedCall& call, const char* function) { return call.symbols.front() == function; }

long addressesOfHost() {
  char** list = nullptr;
  int count = 0;
  if (getAllIPAddresses(&list, &count) != 0 || list == nullptr) return 0;
  for (char** entry = list; *entry != nullptr; ++entry) free(*entry);
  free(static_cast<void*>(list));
  return count;
}

// The table of leaks in docs/compatibility.md. What only first calls leave is not here.
Left requiredLeft(const ExportedCall& call, long addresses) {
  if (is(call, "putEnvVar") || is(call, "getVRABaseSchemaDirPath")) return {1, 0};
  if (is(call, "getAllIPAddresses_Linux")) return {0, 1};
  if (is(call, "isValidIPAddressOnSystem")) return {1 + addresses, 1};
  return {};
}

// How often a call is made, compared with others. Expensive calls are rare, and so are those that
// leave something: blocks that stay keep free memory between them from being given back.
int weightOf(const ExportedCall& call, const Left& left) {
  if (call.enters == Enters::kShell || left.blocks != 0 || left.descriptors != 0) return 10;
  if (call.enters == Enters::kResolver || is(call, "_Z9ldtr_initv")) return 30;
  const bool waits_or_fills = call.once || call.meanwhile == Meanwhile::kNoUseOfEditedFiles;
  if (waits_or_fills) return 100;
  return call.enters == Enters::kAccounts ? 300 : 1000;
}

std::string nameOf(const ExportedCall& call) {
  std::string symbol = call.symbols.front();
  std::erase(symbol, '*');
  int status = 0;
  char* const readable = abi::__cxa_demangle(symbol.c_str(), nullptr, nullptr, &status);
  std::string name = status == 0 ? readable : symbol;
  free(readable);
  name.resize(std::min(name.find('('), name.size()));
  return symbol.find("C2E") == std::string::npos ? name : name + " (of a base)";
}

// ---- The process ----

std::set<int> descriptorsOfProcess() {
  std::set<int> found;
  DIR* const directory = opendir("/proc/self/fd");
  if (directory == nullptr) return found;
  while (const dirent* const entry = readdir(directory)) {
    if (entry->d_name[0] != '.') found.insert(atoi(entry->d_name));
  }
  found.erase(dirfd(directory));
  (void)closedir(directory);
  return found;
}

bool isSocket(int descriptor) {
  struct stat status = {};
  return fstat(descriptor, &status) == 0 && S_ISSOCK(status.st_mode);
}

// In KiB, without the pages of mapped files.
long residentMemory() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("RssAnon:")) return atol(line.c_str() + strlen("RssAnon:"));
  }
  return -1;
}

struct Sample {
  long calls;
  long resident;  // KiB
  long live_bytes;
  long blocks;       // less those that are leaked deliberately
  long descriptors;  // likewise
};

// ---- The calls ----

class Soak {
 public:
  Soak(const std::string& directory, long calls, std::string leak)
      : calls_(makeDirectory(directory + "/calls"), kThreads),
        calls_of_round_(calls / kRounds / static_cast<long>(kThreads)),
        leak_(std::move(leak)),
        totals_(kThreads),
        is_traced_(getenv("TRC_DIR") != nullptr),
        traces_{directory + "/trace0", directory + "/trace1"},
        assignments_{"TRC_DIR=" + traces_[0], "TRC_DIR=" + traces_[1]} {
    const long addresses = addressesOfHost();
    for (const ExportedCall& call : calls_.of(0)) {
      required_.push_back(requiredLeft(call, addresses));
      weights_.push_back(weightOf(call, required_.back()));
      names_.push_back(nameOf(call));
    }
    for (size_t thread = 0; thread < kThreads; ++thread) measureCallsOf(thread);
    samples_.reserve(kRounds);
  }

  void run() {
    std::vector<std::thread> threads;
    for (size_t thread = 0; thread < kThreads; ++thread) {
      threads.emplace_back([this, thread] { work(thread); });
    }
    for (int round = 0; round <= kRounds; ++round) {
      turn_.arrive_and_wait();  // the threads begin
      turn_.arrive_and_wait();  // they have ended
      if (round == kWarmUpRounds) beginMeasuring();
      if (round >= kWarmUpRounds) takeSample();
      readSettingsAgain();
    }
    turn_.arrive_and_wait();
    for (std::thread& thread : threads) thread.join();
  }

  // Prints the tables. Returns the number of findings.
  int report() const {
    int findings = 0;
    printf("%-50s %10s %6s %8s %8s\n", "function", "calls", "wrong", "blocks", "required");
    for (size_t i = 0; i < required_.size(); ++i) {
      const Totals totals = totalsOf(i);
      const long required = required_[i].blocks * totals.calls;
      const bool is_finding = totals.calls == 0 || totals.wrong != 0 || totals.blocks != required;
      printf("%-50s %10ld %6ld %8ld %8ld%s\n", names_[i].c_str(), totals.calls, totals.wrong,
             totals.blocks, required, is_finding ? "  FINDING" : "");
      findings += is_finding;
    }
    printf("\n%10s %14s %12s %12s %12s\n", "calls", "resident KiB", "live KiB", "blocks",
           "descriptors");
    for (size_t i = 0; i<samples_.size(); i += i + 6> samples_.size() ? 1 : 5) {
      const Sample& sample = samples_[i];
      printf("%10ld %14ld %12ld %12ld %12ld\n", sample.calls, sample.resident,
             sample.live_bytes / 1024, sample.blocks, sample.descriptors);
    }
    const Sample& first = samples_.front();
    const Sample& last = samples_.back();
    const auto check = [&](bool is_flat, const char* what) {
      if (!is_flat) printf("FINDING: %s grew\n", what);
      findings += !is_flat;
    };
    // At first the threads' arenas fill up.
    const Sample& settled = samples_[samples_.size() / 2];
    const long explained = (last.live_bytes - settled.live_bytes) / 1024;
    check(last.resident - settled.resident <= explained + kResidentBound, "resident memory");
    check(last.blocks == first.blocks, "the number of blocks");
    check(last.descriptors == first.descriptors, "the number of descriptors");
    if (!trace_moved_) printf("FINDING: the trace could not be moved\n");
    return findings + !trace_moved_;
  }

 private:
  static std::string makeDirectory(const std::string& path) {
    std::filesystem::create_directory(path);
    return path;
  }

  void measureCallsOf(size_t thread) {
    std::vector<ExportedCall>& calls = calls_.of(thread);
    totals_[thread].resize(calls.size());
    for (size_t i = 0; i < calls.size(); ++i) {
      const bool loads = is(calls[i], "loadSharedLib");
      const bool leaks = is(calls[i], "getOSname");
      calls[i].body = [this, body = std::move(calls[i].body), loads, leaks,
                       &totals = totals_[thread][i]] {
        const long before = blocksOfThread();
        const bool right = body();
        if (loads) {  // the loader keeps the text of an error until it is asked for it twice
          (void)dlerror();
          (void)dlerror();
        }
        if (leaks && totals.calls % 100 == 99) leakDeliberately();
        totals += {1, right ? 0 : 1, blocksOfThread() - before};
        return right;
      };
    }
  }

  void leakDeliberately() {
    if (leak_ == "block") leaked_ = malloc(1);
    if (leak_ == "descriptor") (void)dup(STDIN_FILENO);
  }

  void work(size_t thread) {
    const std::vector<ExportedCall>& calls = calls_.of(thread);
    std::minstd_rand random(static_cast<unsigned int>(thread) + 1);
    std::discrete_distribution<size_t> any(weights_.begin(), weights_.end());
    for (int round = 0; round <= kRounds; ++round) {
      turn_.arrive_and_wait();
      if (round == 0 || round == kRounds) {  // none is left out
        for (const ExportedCall& call : calls) (void)calls_.make(thread, call);
      }
      for (long i = 0; i < calls_of_round_; ++i) (void)calls_.make(thread, calls[any(random)]);
      turn_.arrive_and_wait();
    }
    turn_.arrive_and_wait();  // the last sample includes what belongs to the threads
  }

  // Closes the password database, which getUserHomeDir leaves open after an unknown user.
  void closeAccounts() {
    const long before = blocksOfThread();
    endpwent();
    for (size_t i = 0; i < required_.size(); ++i) {
      if (is(calls_.of(0)[i], "getUserHomeDir")) totals_[0][i].blocks += blocksOfThread() - before;
    }
  }

  void beginMeasuring() {
    closeAccounts();
    for (std::vector<Totals>& of_thread : totals_) {
      std::fill(of_thread.begin(), of_thread.end(), Totals{});
    }
    blocks_of_settings_ = 0;
    descriptors_ = descriptorsOfProcess();
  }

  void takeSample() {
    closeAccounts();
    (void)malloc_trim(0);  // only what is in use counts as resident
    Sample sample{0, residentMemory(), liveBytes(), liveBlocks() - blocks_of_settings_, 0};
    long required_descriptors = 0;
    for (size_t i = 0; i < required_.size(); ++i) {
      const long calls = totalsOf(i).calls;
      sample.calls += calls;
      sample.blocks -= required_[i].blocks * calls;
      required_descriptors += required_[i].descriptors * calls;
    }
    const std::set<int> open = descriptorsOfProcess();
    sample.descriptors = static_cast<long>(open.size()) + closed_ - required_descriptors;
    for (const int descriptor : open) {
      if (descriptors_.contains(descriptor) || !isSocket(descriptor)) continue;
      (void)close(descriptor);
      ++closed_;
    }
    samples_.push_back(sample);
  }

  // While no call is being made.
  void readSettingsAgain() {
    ++configfile_read;
    (void)AutoLock::ReadAndSetLockType(1);
    ++blocks_of_settings_;  // the value of AUTOLOCKTYPE
    if (!is_traced_) return;
    trace_ = 1 - trace_;
    std::filesystem::remove_all(traces_[trace_]);
    (void)putenv(assignments_[trace_].data());
    trace_moved_ = trcInit() == 0 && trace_moved_;
    ++blocks_of_settings_;  // libtrc keeps its former settings
    (void)!truncate(getenv("PRINT_DEBUG_FILE"), 0);
  }

  Totals totalsOf(size_t call) const {
    Totals sum;
    for (const std::vector<Totals>& of_thread : totals_) sum += of_thread[call];
    return sum;
  }

  CallsOfThreads calls_;
  long calls_of_round_;  // by each thread
  std::string leak_;
  std::atomic<void*> leaked_ = nullptr;
  std::vector<Left> required_;  // of each call
  std::vector<int> weights_;
  std::vector<std::string> names_;
  std::vector<std::vector<Totals>> totals_;  // of each thread and call
  std::barrier<> turn_{kThreads + 1};
  std::vector<Sample> samples_;
  std::set<int> descriptors_;  // open after the warm-up
  long closed_ = 0;            // of the sockets that functions left open
  long blocks_of_settings_ = 0;
  bool is_traced_;
  std::string traces_[2];
  std::string assignments_[2];
  int trace_ = 0;
  bool trace_moved_ = true;
};

// ---- The program ----

constexpr const char kInside[] = "--inside";

// Starts this program again in a small world of its own, where the settings are made before the
// libraries read them.
int startInside(const char* mode, const char* calls, const char* leak) {
  const TempDir temp;
  const std::string& directory = temp.path();
  // The link's text is a path outside of a chroot once the process has another mount namespace.
  const std::string program = std::filesystem::read_symlink("/proc/self/exe");
  return withPrivateNetwork([&] {
    if (mount("tmpfs", directory.c_str(), "tmpfs", 0, nullptr) != 0 ||
        sethostname("localhost", strlen("localhost")) != 0) {
      perror("soak");
      return 2;
    }
    writeFile("/etc/hosts", "127.0.0.1 localhost\n");
    (void)setenv("AUTOLOCKTYPE", "TIMED", 1);
    for (const char* name : {"TRC_DIR", "TRC_EVENTS", "TRC_MAX_BYTES", "TRC_MODE", "PRINT_DEBUG"}) {
      (void)unsetenv(name);
    }
    if (strcmp(mode, "on") == 0) {
      (void)setenv("TRC_DIR", (directory + "/trace").c_str(), 1);
      (void)setenv("TRC_EVENTS", "all", 1);
      (void)setenv("PRINT_DEBUG", "all", 1);
      (void)setenv("PRINT_DEBUG_FILE", (directory + "/printed").c_str(), 1);
    }
    (void)execl(program.c_str(), "soak", kInside, directory.c_str(), calls, leak, nullptr);
    perror("soak");
    return 2;
  });
}

int soakInside(const char* directory, const char* calls, const char* leak) {
  rlimit limit = {};
  (void)getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = limit.rlim_max;
  (void)setrlimit(RLIMIT_NOFILE, &limit);

  Soak soak(directory, atol(calls), leak);
  soak.run();
  const int findings = soak.report();
  printf("findings: %d\n", findings);
  return findings == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 5 && strcmp(argv[1], kInside) == 0) return soakInside(argv[2], argv[3], argv[4]);
  const bool has_mode = argc >= 3 && (strcmp(argv[1], "off") == 0 || strcmp(argv[1], "on") == 0);
  if (!has_mode || argc > 4) {
    fprintf(stderr, "usage: soak off|on CALLS [block|descriptor]\n");
    return 2;
  }
  return startInside(argv[1], argv[2], argc == 4 ? argv[3] : "none");
}
