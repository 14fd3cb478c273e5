#include "text.h"

#include <errno.h>
#include <string.h>

#include "command.h"

namespace traces {
namespace {

constexpr size_t kMostUnwritten = 65'536;  // bytes

void addNumber(std::string& object, const char* key, std::optional<int64_t> value) {
  object += ",\"";
  object += key;
  object += "\":";
  if (value) {
    append(object, *value);
  } else {
    object += "null";
  }
}

const char* wordOf(bool value) { return value ? "true" : "false"; }

}  // namespace

std::string jsonText(std::string_view text) {
  return Answer(text).dump(-1, ' ', false, Answer::error_handler_t::replace);
}

const std::string& FunctionTexts::of(const Function& function) {
  if (function.index >= texts_.size()) texts_.resize(function.index + 1);
  std::string& text = texts_[function.index];
  if (text.empty()) text = jsonText(function.name);
  return text;
}

std::string JsonObjects::of(const Call& call, bool has_only_begun) {
  const auto known = [](bool is_known, int64_t value) {
    return is_known ? std::optional(value) : std::nullopt;
  };
  std::string object = opening(*call.thread, *call.function, call.depth);
  addNumber(object, "begin", known(call.has_entry, call.begin));
  addNumber(object, "end", known(!has_only_begun, call.end));
  addNumber(object, "own", known(call.has_entry && !has_only_begun, call.own()));
  addNumber(object, "code", call.code);
  object += R"(,"failed":)";
  object += call.failed == Failed::kUnknown ? "null" : wordOf(call.failed == Failed::kYes);
  object += R"(,"finished":)";
  object += wordOf(call.has_exit);
  return object + '}';
}

std::string JsonObjects::of(const Message& message) {
  std::string object = opening(*message.thread, *message.function, message.depth);
  addNumber(object, "time", message.time);
  object += R"(,"error":)";
  object += wordOf(message.is_error);
  object += R"(,"text":)";
  return object + jsonText(message.text) + '}';
}

std::string JsonObjects::opening(const Thread& thread, const Function& function, unsigned depth) {
  if (process_ != thread.process) {
    process_ = thread.process;
    process_text_ = R"({"host":)" + jsonText(process_->host) + R"(,"program":)" +
                    jsonText(process_->program) + R"(,"pid":)" + std::to_string(process_->id) +
                    R"(,"tid":)";
  }
  std::string object = process_text_;
  append(object, thread.id);
  object += R"(,"depth":)";
  append(object, depth);
  object += R"(,"function":)";
  return object + functions_.of(function);
}

void Output::add(std::string_view text) {
  text_ += text;
  if (text_.size() > kMostUnwritten) write();
}

void Output::write() {
  if (fwrite(text_.data(), 1, text_.size(), file_) != text_.size()) {
    throw Failure(OSUTILS_OPERATIONS_ERROR, "cannot write to " + name_ + ": " + strerror(errno));
  }
  text_.clear();
}

}  // namespace traces
