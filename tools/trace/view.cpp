#include "view.h"

#include <inttypes.h>
#include <stdio.h>
#include <unistd.h>

#include <chrono>
#include <fstream>

namespace traces {
namespace {

constexpr int64_t kNanosecondsPerSecond = 1'000'000'000;

// The digits after a decimal point, in units of 10^-9.
std::optional<int64_t> fractionFrom(std::string_view digits) {
  if (digits.empty() || digits.size() > 9) return std::nullopt;
  int64_t value = 0;
  for (size_t i = 0; i < 9; ++i) {
    const char digit = i < digits.size() ? digits[i] : '0';
    if (digit < '0' || digit > '9') return std::nullopt;
    value = value * 10 + (digit - '0');
  }
  return value;
}

// "NUMBER NAME" on each line that is not blank and no comment.
Names namesFrom(const std::string& path) {
  requireRegularFile(path);
  std::ifstream file(path);
  if (!file) throw Failure("cannot read the names in " + path, path);
  Names names;
  size_t number = 0;
  for (std::string line; std::getline(file, line);) {
    ++number;
    const size_t begin = line.find_first_not_of(" \t\r");
    if (begin == std::string::npos || line[begin] == '#') continue;
    const auto refuse = [&](const char* why) {
      return Failure(OSUTILS_CONSTRAINT_VIOLATION,
                     "line " + std::to_string(number) + " of " + path + " " + why);
    };
    const size_t end = std::min(line.find_first_of(" \t", begin), line.size());
    std::string_view digits(line.data() + begin, end - begin);
    const bool is_hexadecimal = digits.starts_with("0x") || digits.starts_with("0X");
    if (is_hexadecimal) digits.remove_prefix(2);
    uint64_t value = 0;
    const auto [after, error] = std::from_chars(digits.data(), digits.data() + digits.size(), value,
                                                is_hexadecimal ? 16 : 10);
    if (error != std::errc() || after != digits.data() + digits.size()) {
      throw refuse("does not begin with a number");
    }
    const size_t name = line.find_first_not_of(" \t\r", end);
    if (name == std::string::npos) throw refuse("has no name");
    const size_t last = line.find_last_not_of(" \t\r");
    if (!names.try_emplace(value, line.substr(name, last - name + 1)).second) {
      throw refuse("names a number again");
    }
  }
  if (file.bad()) throw Failure("cannot read the names in " + path, path);
  return names;
}

// A line on the terminal, after a second.
class Progress {
 public:
  // Lines that a view writes meanwhile must not be on the same terminal.
  explicit Progress(bool is_writing)
      : is_terminal_(isatty(STDERR_FILENO) == 1 && !(is_writing && isatty(STDOUT_FILENO) == 1)) {}
  ~Progress() {
    if (is_shown_) (void)fputs("\r\x1b[K", stderr);
  }
  Progress(const Progress&) = delete;
  Progress& operator=(const Progress&) = delete;

  void show(uint64_t records, std::optional<double> part) {
    if (!is_terminal_) return;
    const auto now = std::chrono::steady_clock::now();
    if (now < next_) return;
    next_ = now + std::chrono::milliseconds(100);
    is_shown_ = true;
    std::string line = "\r";
    if (part) {
      constexpr int kWidth = 30;
      const int done = static_cast<int>(*part * kWidth);
      line += '[' + std::string(static_cast<size_t>(done), '#') +
              std::string(static_cast<size_t>(kWidth - done), ' ') + "] ";
    }
    line += std::to_string(records) + " records\x1b[K";
    (void)fputs(line.c_str(), stderr);
  }

 private:
  const bool is_terminal_;
  bool is_shown_ = false;
  std::chrono::steady_clock::time_point next_ =
      std::chrono::steady_clock::now() + std::chrono::seconds(1);
};

Reading readOnce(const Options& options, Visitor& visitor, bool is_writing, const Reading* first) {
  Settings settings;
  settings.first = first;
  if (options.names) settings.names = namesFrom(*options.names);
  if (options.from) settings.from = timeFrom(*options.from, "--from");
  if (options.to) settings.to = timeFrom(*options.to, "--to");
  if (settings.from >= settings.to) throw Usage("--from is not before --to");
  Progress progress(is_writing);
  settings.progress = [&](uint64_t records, std::optional<double> part) {
    progress.show(records, part);
  };
  return read(options.paths, settings, visitor);
}

void reportUnreadable(Tool& tool, const Reading& reading) {
  for (const std::string& problem : reading.problems) tool.reportError(problem);
  if (reading.unreadable > reading.problems.size()) {
    tool.reportError("and " + std::to_string(reading.unreadable - reading.problems.size()) +
                     " more that could not be read");
  }
}

}  // namespace

Reading readCalls(Tool& tool, const Options& options, Visitor& visitor, bool is_writing) {
  Reading reading = readOnce(options, visitor, is_writing, nullptr);
  reportUnreadable(tool, reading);
  if (reading.foreign > 0) {
    const std::string line =
        counted(reading.foreign, "event") + " not of traced functions left out";
    if (reading.records == 0) {
      tool.reportError(line + ": no others");
    } else {
      tool.report(line);
    }
  }
  if (reading.discarded > 0) {
    tool.report(counted(reading.discarded, "record") + " missing: the tracer discarded them");
  }
  return reading;
}

Reading readAgain(Tool& tool, const Options& options, Visitor& visitor, const Reading& before,
                  bool is_writing) {
  Reading reading = readOnce(options, visitor, is_writing, &before);
  if (reading.unreadable > before.unreadable) reportUnreadable(tool, reading);
  if (const std::string loss = lossOf(before, reading); !loss.empty()) tool.reportError(loss);
  return reading;
}

std::string counted(uint64_t number, const char* what) {
  return std::to_string(number) + " " + what + (number == 1 ? "" : "s");
}

// libbabeltrace2 leaves out files that it cannot look at, without an error, and a flight recorder overwrites records.
std::string lossOf(const Reading& before, const Reading& again) {
  if (again.again >= before.records) return "";
  return counted(before.records - again.again, "record") +
         " missing that were there when the trace was read first";
}

std::string timeText(int64_t time) {
  const std::chrono::sys_time<std::chrono::nanoseconds> point{std::chrono::nanoseconds(time)};
  const auto midnight = std::chrono::floor<std::chrono::days>(point);
  const std::chrono::year_month_day day(midnight);
  const std::chrono::hh_mm_ss clock(point - midnight);
  char text[64];
  (void)snprintf(text, sizeof text, "%04d-%02u-%02uT%02d:%02d:%02d.%09" PRId64 "Z",
                 static_cast<int>(day.year()), static_cast<unsigned>(day.month()),
                 static_cast<unsigned>(day.day()), static_cast<int>(clock.hours().count()),
                 static_cast<int>(clock.minutes().count()),
                 static_cast<int>(clock.seconds().count()),
                 static_cast<int64_t>(clock.subseconds().count()));
  return text;
}

int64_t timeFrom(const std::string& text, const char* option) {
  const auto refuse = [&] {
    return Usage(std::string(option) +
                 " is not a time like 2026-01-31T12:00:00.5Z: " + inQuotes(text));
  };
  std::string_view rest = text;
  if (rest.ends_with('Z')) rest.remove_suffix(1);
  constexpr std::string_view kForm = "dddd-dd-ddTdd:dd:dd";
  if (rest.size() < kForm.size()) throw refuse();
  for (size_t i = 0; i < kForm.size(); ++i) {
    const bool is_digit = rest[i] >= '0' && rest[i] <= '9';
    if (kForm[i] == 'd' ? !is_digit : rest[i] != kForm[i]) throw refuse();
  }
  const auto number = [&](size_t at, size_t digits) {
    int value = 0;
    for (size_t i = at; i < at + digits; ++i) value = value * 10 + (rest[i] - '0');
    return value;
  };
  const std::chrono::year_month_day day(std::chrono::year(number(0, 4)),
                                        std::chrono::month(static_cast<unsigned>(number(5, 2))),
                                        std::chrono::day(static_cast<unsigned>(number(8, 2))));
  const int hour = number(11, 2);
  const int minute = number(14, 2);
  const int second = number(17, 2);
  // What nanoseconds since 1970 can hold.
  if (!day.ok() || number(0, 4) < 1678 || number(0, 4) > 2261 || hour > 23 || minute > 59 ||
      second > 60) {
    throw refuse();
  }
  std::optional<int64_t> fraction = 0;
  if (rest.size() > kForm.size()) {
    if (rest[kForm.size()] != '.') throw refuse();
    fraction = fractionFrom(rest.substr(kForm.size() + 1));
    if (!fraction) throw refuse();
  }
  const int64_t days = std::chrono::sys_days(day).time_since_epoch().count();
  return (((days * 24 + hour) * 60 + minute) * 60 + second) * kNanosecondsPerSecond + *fraction;
}

std::string durationText(int64_t nanoseconds) {
  struct Unit {
    double size;
    const char* name;
  };
  constexpr Unit kUnits[] = {{1e9, "s"}, {1e6, "ms"}, {1e3, "us"}};
  for (const Unit& unit : kUnits) {
    const double value = static_cast<double>(nanoseconds) / unit.size;
    if (value < 1) continue;
    char text[32];
    (void)snprintf(text, sizeof text, "%.*f%s",
                   value < 10    ? 2
                   : value < 100 ? 1
                                 : 0,
                   value, unit.name);
    return text;
  }
  return std::to_string(nanoseconds) + "ns";
}

int64_t durationFrom(const std::string& text, const char* option) {
  constexpr int64_t kMostNanoseconds = 1'000'000'000 * kNanosecondsPerSecond;
  const auto refuse = [&] {
    return Usage(std::string(option) +
                 " is not a time like 5ms, 0.5s, 20us or 100ns: " + inQuotes(text));
  };
  const size_t digits = std::min(text.find_first_not_of("0123456789."), text.size());
  const std::string unit = text.substr(digits);
  const int64_t size = unit == "ns"   ? 1
                       : unit == "us" ? 1'000
                       : unit == "ms" ? 1'000'000
                       : unit == "s"  ? kNanosecondsPerSecond
                                      : 0;
  const std::string_view number(text.data(), digits);
  const size_t point = std::min(number.find('.'), number.size());
  int64_t whole = 0;
  const auto [end, error] = std::from_chars(number.data(), number.data() + point, whole);
  if (size == 0 || error != std::errc() || end != number.data() + point ||
      whole > kMostNanoseconds / size) {
    throw refuse();
  }
  std::optional<int64_t> fraction = 0;
  if (point < number.size()) fraction = fractionFrom(number.substr(point + 1));
  if (!fraction) throw refuse();
  return whole * size + *fraction * size / kNanosecondsPerSecond;
}

}  // namespace traces
