// The name, screen and time commands.
#include <memory>

#include "command.h"

namespace checks {
namespace {

Answer screen(const std::vector<std::string>& texts) {
  Answer list = Answer::array();
  for (std::string text : texts) {
    const bool passes = !checkForMetaChars(text.data());
    list.push_back({{"text", text}, {"passes", passes}});
  }
  return list;
}

}  // namespace

void addCommands(CLI::App& tool, Chosen& chosen) {
  const auto name = std::make_shared<std::string>();
  CLI::App& family = *tool.add_subcommand("name", "Ask about names");
  family.require_subcommand(1);
  addQuestion(family, chosen, "check",
              "Ask whether an instance, a user or a group may get the name",
              [name]() -> Answer {
                return {{"name", *name}, {"valid", isValidName(name->data())}};
              })
      .add_option("NAME", *name, "The name")
      ->required()
      ->type_name("");

  // The option's own results, not a vector bound to it: that takes "[a,b]" for two texts, and a text
  // must not pass without its brackets. So many values are "expected" to let it take all there are.
  const auto texts = std::make_shared<const CLI::Option*>();
  *texts = addQuestion(tool, chosen, "screen",
                       "Ask whether texts pass the screening for characters that a shell "
                       "interprets.\nBlanks, tabs and \"#\" pass",
                       [texts] { return screen((*texts)->results()); })
               .add_option("TEXT")
               ->description("Put -- before texts that begin with \"-\"")
               ->required()
               ->option_text("REQUIRED")
               ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll)
               ->expected(CLI::detail::expected_max_vector_size - 1,
                          CLI::detail::expected_max_vector_size);

  const auto compact = std::make_shared<bool>(false);
  addCommand(tool, chosen, "time", "Show the local time", [compact]() -> Answer {
    return {{"time", take(getCurrentTimeStamp(*compact ? 0 : 1))}};
  }).add_flag("--compact", *compact, "As the shorter stamp, which can be part of a file name");
}

}  // namespace checks
