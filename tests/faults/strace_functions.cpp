// The scenarios of the exported functions, each run by the program run_scenario.
#include <sstream>

#include "strace_subjects.h"
#include "world.h"

std::vector<Subject> functionSubjects(const std::string& directory, const std::string& scratch) {
  std::vector<Subject> subjects;
  std::istringstream names(run({RUN_SCENARIO, "list"}, kEnvironment, scratch).out);
  for (std::string name; std::getline(names, name);) {
    const auto prepare = [=] {
      (void)run({RUN_SCENARIO, "prepare", name, directory}, kEnvironment, scratch);
    };
    const auto judge = [=](const Ended& ended, const Ended&, const std::string&) -> std::string {
      if (ended.status != 0) return "ended with " + std::to_string(ended.status) + " " + ended.err;
      Words words = {RUN_SCENARIO, "judge"};
      if (ended.struck.empty()) words.push_back("--good");
      words.insert(words.end(), {name, directory});
      const std::string result = scratch + "/result";  // may be too long for an argument
      writeFile(result, ended.out);
      const Ended judged = run(words, kEnvironment, scratch, result);
      if (judged.status == 0) return "";
      return "judged " + std::to_string(judged.status) + ": " + judged.out + judged.err;
    };
    subjects.push_back({name.substr(0, name.find_first_of(" ,")),
                        name,
                        false,
                        true,
                        {RUN_SCENARIO, "run", "--stop", name, directory},
                        kEnvironment,
                        prepare,
                        [] { return std::string(); },
                        judge});
  }
  return subjects;
}
