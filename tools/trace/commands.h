// The trace commands. The program osutils declares them and runs osutils-trace for them, so that it starts without
// libbabeltrace2.
#pragma once

#include "command.h"

namespace traces {

// The options and arguments of all views.
struct Options {
  std::vector<std::string> paths;
  std::optional<std::string> names;
  std::optional<std::string> from;
  std::optional<std::string> to;
  std::optional<std::string> sort;
  std::optional<std::string> by;
  bool errors = false;
  bool only_failed = false;
  std::optional<std::string> min_time;
  std::optional<std::string> function;
  std::optional<std::string> format;
  std::optional<std::string> output;
  bool force = false;
};

struct Views {
  std::function<Answer(Options&)> summary;
  std::function<Answer(Options&)> tree;
  std::function<Answer(Options&)> exports;
  std::function<Answer(Options&, bool dry_run)> report;
};

void addCommands(Tool& tool, const Views& views);

// The views of osutils-trace. They report what could not be read through the tool.
Answer summarize(Tool& tool, Options& options);
Answer showTree(Tool& tool, Options& options);
Answer exportCalls(Tool& tool, Options& options);
Answer reportCalls(Tool& tool, Options& options, bool dry_run);

}  // namespace traces
