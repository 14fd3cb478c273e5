#include "commands.h"

namespace traces {
namespace {

constexpr const char* kSortKeys[] = {"total",   "own",   "mean",     "median",  "p99",
                                     "longest", "calls", "failures", "function"};
constexpr const char* kSubjects[] = {"process", "thread", "function"};
constexpr const char* kFormats[] = {"chrome", "folded", "jsonl"};

}  // namespace

void addCommands(Tool& tool, const Views& views) {
  Command& family = tool.family("trace", "Read traces: find the slow call and the failed call");
  const auto options = std::make_shared<Options>();
  const auto bound = [&](const std::function<Answer(Options&)>& view) {
    return [options, view] { return view(*options); };
  };
  const auto takeCommon = [&](Command& command) {
    tool.option(command, "--from", "TIME", options->from,
                "Only calls that begin, and messages, at or after this time (UTC),\n"
                "as in 2026-01-31T12:00:00.5Z");
    tool.option(command, "--to", "TIME", options->to, "The same, before this time");
    tool.option(command, "--names", "FILE", options->names,
                "Names of functions: lines of a number and a name", kFile);
    tool.argumentsAmongOptions(command, "PATH", options->paths,
                               "Folders of traces; also those below them are read", kDirectory);
  };

  Command& summary = tool.command(family, "summary", "Count and time the calls of each function",
                                  bound(views.summary));
  tool.option(summary, "--sort", "KEY", options->sort,
              "Sort by total (if not given), own, mean, median, p99, longest,\n"
              "calls, failures or, in lines of functions, function",
              oneOf(kSortKeys));
  tool.option(summary, "--by", "WHAT", options->by,
              "A line for each process, thread or function (if not given)", oneOf(kSubjects));
  tool.flag(summary, "--errors", options->errors, "Only lines with failures");
  takeCommon(summary);

  Command& tree =
      tool.command(family, "tree",
                   "Show the calls of each thread, nested, with their messages. A call\n"
                   "around very many lines is shown when it begins and when it ends",
                   bound(views.tree));
  tool.flag(tree, "--only-failed", options->only_failed,
            "Only failed calls, in the calls around them");
  tool.option(tree, "--min-time", "TIME", options->min_time,
              "Only calls of at least this time, as 5ms, 0.5s, 20us or 100ns");
  tool.option(tree, "--function", "NAME", options->function,
              "Only calls of this function, with those that they make");
  takeCommon(tree);

  Command& exports =
      tool.command(family, "export",
                   "Print calls and messages in a format of other programs. --json is not\n"
                   "for this command",
                   bound(views.exports));
  tool.option(exports, "--format", "FORMAT", options->format,
              "chrome: for ui.perfetto.dev, speedscope and chrome://tracing;\n"
              "folded: stacks with their own times, for flame graphs;\n"
              "jsonl: a JSON object on each line, for scripts",
              oneOf(kFormats));
  takeCommon(exports);

  Command& report =
      tool.change(family, "report",
                  "Make one page of HTML with a timeline and a summary, which needs no\n"
                  "network and no other file",
                  [options, view = views.report](bool dry_run) { return view(*options, dry_run); });
  tool.option(report, "--output,-o", "FILE", options->output, "The page, which must not exist",
              kFile);
  tool.flag(report, "--force", options->force, "Replace the page if it exists");
  takeCommon(report);
}

}  // namespace traces
