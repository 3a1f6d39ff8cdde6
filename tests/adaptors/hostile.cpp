// An adaptor that does what adaptors should not. What it does is said by the events that it gets, and for its creation
// by the environment variable HOSTILE_ADAPTOR.
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <string>

#include "platform/VelkReportingQuillAdaptor.h"

namespace {

void say(const char* text) {
  const std::string line = std::string("hostile adaptor: ") + text + "\n";
  static_cast<void>(!::write(STDERR_FILENO, line.data(), line.size()));
}

[[noreturn]] void blockForEver() {
  for (;;) ::pause();
}

int32_t sendMessage(void*, uint16_t, uint16_t, const char* dict, size_t) {
  const auto asks = [dict](const char* word) { return dict != nullptr && std::strstr(dict, word) != nullptr; };
  if (asks("throw an error")) throw std::runtime_error("an error with a\nline break");
  if (asks("throw a number")) throw 5;
  if (asks("refuse")) return 7;
  if (asks("block")) {
    say("blocking");
    blockForEver();
  }
  say("took an event");
  return 0;
}

void release(void*) { say("released"); }

}  // namespace

int32_t VelkReportingCreateQuillAdaptor(uint32_t, VelkReportingQuillAdaptor* adaptor) {
  const char* const variable = std::getenv("HOSTILE_ADAPTOR");
  const std::string wish = variable != nullptr ? variable : "";
  if (wish == "refuse") return 9;
  if (wish == "throw") throw std::logic_error("not today");
  if (wish == "block") {
    say("blocking");
    blockForEver();
  }
  if (wish != "deaf") adaptor->sendMessageWithMethod = sendMessage;
  adaptor->release = release;
  return 0;
}
