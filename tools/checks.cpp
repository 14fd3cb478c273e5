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

void addCommands(Tool& tool) {
  const auto name = std::make_shared<std::string>();
  tool.question(tool.family("name", "Check names"), "check",
                "Ask whether the name is valid for an instance, a user or a group",
                [name]() -> Answer {
                  return {{"name", *name}, {"valid", isValidName(name->data())}};
                },
                {{"NAME", name.get(), "The name"}});

  const auto texts = std::make_shared<std::vector<std::string>>();
  tool.arguments(tool.question(tool.all(), "screen",
                               "Ask whether texts are free of characters that a shell interprets.\n"
                               "Blanks, tabs and \"#\" are allowed",
                               [texts] { return screen(*texts); }),
                 "TEXT", *texts, "Put -- before texts that begin with \"-\"");

  const auto compact = std::make_shared<bool>(false);
  tool.flag(
      tool.command(tool.all(), "time", "Show the local time",
                   [compact]() -> Answer {
                     return {{"time", orNoMemory(osutils::getCurrentTimeStamp(*compact ? 0 : 1))}};
                   }),
      "--compact", *compact, "Show it in a shorter form that can be part of a file name");
}

}  // namespace checks
