// ratios [--strict] [--group GROUP]... REPORT... [--run REPORT...]...: prints one table from the JSON files of one or
// several whole runs, of all rows or of those of the groups, which are the names of benchmarks up to the slash. The exit
// status is 1 if a benchmark failed, with --strict also if a row missed its bound.
//
// A row's figure is the median of the runs, and its spread their lowest and highest figure. Of a single run the spread
// is that of the middle half of the repetitions.
#include <stdio.h>

#include <algorithm>
#include <exception>
#include <fstream>
#include <iostream>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace {

// A row's figure of one run, from the medians of the repetitions unless it says otherwise.
enum class Figure {
  kCpuRatio,       // CPU time divided by the peer's
  kCpuDifference,  // CPU time minus the peer's, in ns
  kBestRatio,      // elapsed time of the fastest repetition divided by the peer's
  kRealRatio,      // elapsed time, or what the benchmark counts as such, divided by the peer's
  kCounter,        // the highest value of a counter of the benchmark; `peer` is its name
  kMedianCounter,  // its median
  kMilliseconds,   // CPU time; `peer` is not used
};

bool isCounter(Figure figure) {
  return figure == Figure::kCounter || figure == Figure::kMedianCounter;
}

bool hasPeer(Figure figure) { return !isCounter(figure) && figure != Figure::kMilliseconds; }

struct Row {
  const char* what;
  const char* ours;
  const char* peer;
  Figure figure;
  std::optional<double> at_most;  // none: for information
};

const Row kRows[] = {
    {"off: getEnvVar / ldap_getenv + null test", "environment/getEnvVar", "environment/ldap_getenv",
     Figure::kCpuRatio, 1.10},
    {"off: a function with the frame - without, ns", "frame/with", "frame/without",
     Figure::kCpuDifference, 1.0},
    {"off: a function with the frame / with 2 LTTng-UST tracepoints off", "tracepoints_off/frame",
     "tracepoints_off/lttng", Figure::kCpuRatio, 1.15},
    {"on: entry and exit record / bare mapped ring", "record/trcWriteRec", "record/ring",
     Figure::kCpuRatio, 1.10},
    {"    the kernel's part of such a record, new pages, ns",
     "record/new_pages",
     "ns_per_record",
     Figure::kMedianCounter,
     {}},
    {"on: entry and exit record / LTTng-UST flight recorder", "event/trcWriteRec", "event/lttng",
     Figure::kCpuRatio, 0.35},
    {"on: LTTng's trace library / bare LTTng tracepoints of its fields", "lttng/trcWriteRec",
     "lttng/tracepoints", Figure::kCpuRatio, 1.10},
    {"on: debug record / ring + calloc + snprintf", "debug/ldtr", "debug/ring", Figure::kCpuRatio,
     1.35},
    {"on: debug record / spdlog to a file", "debug/ldtr", "debug/spdlog", Figure::kCpuRatio, 1.05},
    {"on: CPU per record, 2 threads / 1 thread", "threads/two", "threads/one", Figure::kCpuRatio,
     1.10},
    {"latest: entry and exit record / bare mapped ring", "latest_record/trcWriteRec",
     "latest_record/ring", Figure::kCpuRatio, 0.80},
    {"latest: entry and exit record / LTTng-UST flight recorder", "latest_event/trcWriteRec",
     "latest_event/lttng", Figure::kCpuRatio, 0.25},
    {"latest: debug record / ring + calloc + snprintf", "latest_debug/ldtr", "latest_debug/ring",
     Figure::kCpuRatio, 1.20},
    {"latest: debug record / spdlog to a file", "latest_debug/ldtr", "latest_debug/spdlog",
     Figure::kCpuRatio, 1.0},
    {"latest: CPU per record, 2 threads / 1 thread", "latest_threads/two", "latest_threads/one",
     Figure::kCpuRatio, 1.10},
    {"    the same of the bare mapped ring",
     "threads/ring_two",
     "threads/ring_one",
     Figure::kCpuRatio,
     {}},
    {"trace summary / babeltrace2 printing the same 10 million records", "reading/summary",
     "reading/babeltrace2", Figure::kCpuRatio, 0.5},
    {"trace summary, memory for 10 million records, MiB", "summary/memory", "mib", Figure::kCounter,
     64},
    {"trace report, a page of 200,000 records opens in Chromium, s", "page/open", "seconds",
     Figure::kMedianCounter, 2},
    {"trace report, the longest frame while that page is zoomed, ms", "page/zoom",
     "ms_of_longest_frame", Figure::kCounter, 100},
    {"bytes of an entry record", "bytes/entry_and_exit", "entry", Figure::kCounter, 48},
    {"bytes of an exit record", "bytes/entry_and_exit", "exit", Figure::kCounter, 48},
    {"bytes of a debug record without its text", "bytes/debug", "without_text", Figure::kCounter,
     56},
    {"readEtcServices + free / getservent loop, 300 lines", "services/readEtcServices/300",
     "services/getservent/300", Figure::kCpuRatio, 0.6},
    {"readEtcServices + free / getservent loop, 12,000 lines", "services/readEtcServices/12000",
     "services/getservent/12000", Figure::kCpuRatio, 0.6},
    {"readEtcServices + free / getservent loop, 1,000,000 lines",
     "services/readEtcServices/1000000", "services/getservent/1000000", Figure::kCpuRatio, 0.9},
    {"findAvaliablePort, 65,535 ports taken, ms", "ports/findAvaliablePort", "",
     Figure::kMilliseconds, 20},
    {"copyFile / cp over an empty file, 1 GiB, best of the runs", "copy_large/copyFile",
     "copy_large/cp_over", Figure::kBestRatio, 1.05},
    {"    the same / cp to a new file",
     "copy_large/copyFile",
     "copy_large/cp",
     Figure::kBestRatio,
     {}},
    {"copyFile / its own system calls, 1 MiB", "copy_small/copyFile", "copy_small/bare",
     Figure::kCpuRatio, 1.05},
    {"copyFile / blocks of 64 KiB, 16 MiB to another file system", "copy_across/copyFile",
     "copy_across/blocks", Figure::kCpuRatio, 1.10},
    {"doesFileExist / stat64", "query/doesFileExist", "query/stat64", Figure::kCpuRatio, 1.05},
    {"vra_getpwnam_uid / getpwnam, 20 accounts", "account/vra_getpwnam_uid", "account/getpwnam",
     Figure::kCpuRatio, 1.05},
    {"formatDn / ldap_dn_normalize, 85 bytes", "dn/formatDn/typical",
     "dn/ldap_dn_normalize/typical", Figure::kCpuRatio, 0.1},
    {"formatDn / ldap_dn_normalize, 100 kB of 5,000 components", "dn/formatDn/5000_components",
     "dn/ldap_dn_normalize/5000_components", Figure::kCpuRatio, 0.025},
    {"formatDn / byte automaton from a table, value of 100 kB", "dn/formatDn/long_value",
     "dn/table/long_value", Figure::kCpuRatio, 1.0},
    {"formatDn, ns per byte, value of 100 kB", "dn/formatDn/long_value", "ns_per_byte",
     Figure::kMedianCounter, 2.0},
    {"    the same, 1 MB", "dn_large/value/1000000", "ns_per_byte", Figure::kMedianCounter, {}},
    {"    the same, 100 MB", "dn_large/value/100000000", "ns_per_byte", Figure::kMedianCounter, {}},
    {"    components of 20 bytes, 1 MB",
     "dn_large/components/1000000",
     "ns_per_byte",
     Figure::kMedianCounter,
     {}},
    {"    the same, 100 MB",
     "dn_large/components/100000000",
     "ns_per_byte",
     Figure::kMedianCounter,
     {}},
    {"    strdup + free alone, 1 MB",
     "dn_large/strdup/1000000",
     "ns_per_byte",
     Figure::kMedianCounter,
     {}},
    {"    the same, 100 MB",
     "dn_large/strdup/100000000",
     "ns_per_byte",
     Figure::kMedianCounter,
     {}},
    {"readInittab + free / fgets loop with malloc, 1,000 lines", "inittab/readInittab",
     "inittab/fgets", Figure::kCpuRatio, 0.8},
    {"checkForMetaChars / strpbrk, 80 clean bytes", "screening/checkForMetaChars",
     "screening/strpbrk", Figure::kCpuRatio, 1.10},
    {"osutils --version / getent passwd root, CPU time of the process", "start/osutils",
     "start/getent", Figure::kRealRatio, 2.0},
    {"dlopen + dlclose / mapping a file of its size", "load/dlopen", "load/map", Figure::kCpuRatio,
     1.3},
    {"the library is still loaded after dlclose", "unload/dlclose", "stays_loaded",
     Figure::kCounter, 0},
};

// The repetitions of one benchmark.
struct Runs {
  std::vector<double> cpu_ns;
  std::vector<double> real_ns;
  std::map<std::string, std::vector<double>> counters;
  std::string error;
};

double median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  const size_t half = values.size() / 2;
  return values.size() % 2 == 1 ? values[half] : (values[half - 1] + values[half]) / 2;
}

double nanoseconds(const std::string& unit) {
  if (unit == "ns") return 1;
  if (unit == "us") return 1e3;
  if (unit == "ms") return 1e6;
  return 1e9;
}

void readRuns(const char* path, std::map<std::string, Runs>& runs) {
  std::ifstream file(path);
  const nlohmann::json report = nlohmann::json::parse(file);
  for (const nlohmann::json& run : report.at("benchmarks")) {
    if (run.at("run_type") != "iteration") continue;
    Runs& of_benchmark = runs[run.at("run_name")];
    if (run.value("error_occurred", false)) {
      of_benchmark.error = run.at("error_message");
      continue;
    }
    if (run.contains("time_unit")) {
      const double unit = nanoseconds(run.at("time_unit"));
      of_benchmark.cpu_ns.push_back(run.at("cpu_time").get<double>() * unit);
      of_benchmark.real_ns.push_back(run.at("real_time").get<double>() * unit);
    }
    for (const char* counter : {"entry", "exit", "without_text", "stays_loaded", "ns_per_byte",
                                "ns_per_record", "mib", "seconds", "ms_of_longest_frame"}) {
      if (run.contains(counter)) of_benchmark.counters[counter].push_back(run.at(counter));
    }
  }
}

// The framework appends "/iterations:..." and the like to a benchmark's name.
Runs find(const std::map<std::string, Runs>& runs, const std::string& name) {
  for (const auto& [full_name, found] : runs) {
    if (full_name == name || full_name.starts_with(name + "/")) return found;
  }
  return Runs{{}, {}, {}, "unavailable: not built"};
}

// The figures of the repetitions. The peer's share in each is that of all its repetitions.
std::vector<double> figuresOf(const Row& row, const Runs& ours, const Runs& peer) {
  if (isCounter(row.figure)) {
    const auto counter = ours.counters.find(row.peer);
    return counter == ours.counters.end() ? std::vector<double>() : counter->second;
  }
  if (ours.cpu_ns.empty() || (hasPeer(row.figure) && peer.cpu_ns.empty())) return {};
  const bool is_real = row.figure == Figure::kBestRatio || row.figure == Figure::kRealRatio;
  std::vector<double> figures = is_real ? ours.real_ns : ours.cpu_ns;
  for (double& figure : figures) {
    switch (row.figure) {
      case Figure::kMilliseconds:
        figure /= 1e6;
        break;
      case Figure::kCpuDifference:
        figure -= median(peer.cpu_ns);
        break;
      case Figure::kBestRatio:
        figure /= *std::min_element(peer.real_ns.begin(), peer.real_ns.end());
        break;
      case Figure::kRealRatio:
        figure /= median(peer.real_ns);
        break;
      default:
        figure /= median(peer.cpu_ns);
    }
  }
  return figures;
}

// Of the sorted figures of the repetitions.
double figureOf(const Row& row, const std::vector<double>& figures) {
  if (row.figure == Figure::kBestRatio) return figures.front();
  if (row.figure == Figure::kCounter) return figures.back();
  return median(figures);
}

using Report = std::map<std::string, Runs>;  // of one whole run, by the benchmark's name

// Of all whole runs.
struct Result {
  std::vector<double> figures;
  double lowest = 0;
  double highest = 0;
  std::string error;
};

Result resultOf(const Row& row, const std::vector<Report>& reports) {
  Result result;
  for (const Report& report : reports) {
    const Runs ours = find(report, row.ours);
    const Runs peer = hasPeer(row.figure) ? find(report, row.peer) : Runs{};
    result.error = ours.error.empty() ? peer.error : ours.error;
    std::vector<double> figures;
    if (result.error.empty()) figures = figuresOf(row, ours, peer);
    if (figures.empty()) return Result{{}, 0, 0, result.error.empty() ? "no result" : result.error};
    std::sort(figures.begin(), figures.end());
    result.figures.push_back(figureOf(row, figures));
    result.lowest = figures[figures.size() / 4];
    result.highest = figures[figures.size() - 1 - figures.size() / 4];
  }
  if (reports.size() > 1) {
    const auto [lowest, highest] =
        std::minmax_element(result.figures.begin(), result.figures.end());
    result.lowest = *lowest;
    result.highest = *highest;
  }
  return result;
}

bool isIn(const std::vector<std::string>& groups, const Row& row) {
  const std::string_view ours = row.ours;
  return groups.empty() ||
         std::find(groups.begin(), groups.end(), ours.substr(0, ours.find('/'))) != groups.end();
}

int printTable(const std::vector<Report>& reports, const std::vector<std::string>& groups,
               bool strict) {
  int failed = 0;
  int missed = 0;
  int not_measured = 0;
  printf("\n%-66s %8s %8s %18s\n", "what", "ratio", "at most",
         reports.size() > 1 ? "spread of the runs" : "middle half");
  for (const Row& row : kRows) {
    if (!isIn(groups, row)) continue;
    const Result result = resultOf(row, reports);
    const std::string limit = row.at_most ? std::to_string(*row.at_most).substr(0, 5) : "-";
    if (!result.error.empty()) {
      const bool could_not_run = result.error.starts_with("unavailable: ");
      ++(could_not_run ? not_measured : failed);
      printf("%-66s %8s %8s  not measured: %s\n", row.what, "-", limit.c_str(),
             could_not_run ? result.error.c_str() + sizeof "unavailable: " - 1
                           : ("FAILED: " + result.error).c_str());
      continue;
    }
    const double figure = median(result.figures);
    const bool misses = row.at_most && !(figure <= *row.at_most);
    if (misses) ++missed;
    const char* const verdict = !row.at_most ? "" : misses ? "MISS" : "ok";
    printf("%-66s %8.3f %8s %8.3f to %6.3f  %s\n", row.what, figure, limit.c_str(), result.lowest,
           result.highest, verdict);
  }
  printf("\nrows that missed their bound: %d; not measured: %d; failed: %d\n", missed, not_measured,
         failed);
  return failed > 0 || (strict && missed > 0) ? 1 : 0;
}

}  // namespace

int main(int argc, char** argv) {
  try {
    bool strict = false;
    std::vector<std::string> groups;
    std::vector<Report> reports(1);
    for (int i = 1; i < argc; ++i) {
      const std::string argument = argv[i];
      if (argument == "--strict") {
        strict = true;
      } else if (argument == "--group" && i + 1 < argc) {
        groups.emplace_back(argv[++i]);
      } else if (argument == "--run") {
        reports.emplace_back();
      } else {
        readRuns(argv[i], reports.back());
      }
    }
    return printTable(reports, groups, strict);
  } catch (const std::exception& error) {
    std::cerr << "ratios: " << error.what() << '\n';
    return 1;
  }
}
