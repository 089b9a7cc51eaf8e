/* Targets from words and from the directory. No lock. */
#include "cli/targets.h"

#include <charconv>

namespace cli {
namespace {

/* Words one after another. */
class Words {
 public:
  explicit Words(const std::vector<TargetWord> &words) : words_(words) {}

  bool atEnd() const { return next_ == words_.size(); }
  bool atHint() const { return !atEnd() && words_[next_].isHint; }
  const std::string &take() { return words_[next_++].text; }

  /* The next word, which must be there and be a plain one. */
  const std::string &takeValue(const std::string &group, const char *what) {
    if (atEnd() || atHint()) throw UsageError("\"" + group + "\" wants " + what + " behind it");
    return take();
  }

 private:
  const std::vector<TargetWord> &words_;
  size_t next_ = 0;
};

uint8_t parseType(const std::string &text) {
  const bool hex = text.starts_with("0x") || text.starts_with("0X");
  const char *const begin = text.data() + (hex ? 2 : 0);
  const char *const end = text.data() + text.size();
  unsigned value = 0;
  const auto [stop, error] = std::from_chars(begin, end, value, hex ? 16 : 10);
  if (begin == end || error != std::errc() || stop != end || value > UINT8_MAX) {
    throw UsageError("\"" + text +
                     "\" is no type of an object; write a number from 0 to 255, decimal or as 0x "
                     "hexadecimal, and then the object's UUID");
  }
  return static_cast<uint8_t>(value);
}

bool isReserved(uint8_t type) {
  return type == KARST_TYPE_NODE || type == KARST_TYPE_NET_INTERFACE ||
         type == KARST_TYPE_HEALTH_STATUS;
}

}  // namespace

std::string kindOf(const Target &target) {
  return target.isObject ? "object " + std::to_string(target.type) : "node";
}

zel_UUID parseUUIDFor(const std::string &purpose, const std::string &text) {
  const auto uuid = host::parseUUID(text);
  if (!uuid) {
    throw UsageError(purpose + " wants a UUID, not \"" + text +
                     "\"; write 32 hexadecimal digits, plain or as 8-4-4-4-12");
  }
  if (host::isZero(*uuid)) {
    throw UsageError(purpose + ": the all-zero UUID stands for none; give another one");
  }
  return *uuid;
}

std::vector<Target> parseTargets(const std::vector<TargetWord> &words) {
  std::vector<Target> targets;
  Words rest(words);
  while (!rest.atEnd()) {
    if (rest.atHint()) {
      throw UsageError("--hint stands right behind the object that it is for, once for each");
    }
    const std::string &group = rest.take();
    Target target;
    if (group == "object") {
      target.isObject = true;
      target.type = parseType(rest.takeValue(group, "a type and a UUID"));
    } else if (group != "node") {
      throw UsageError("\"" + group + "\" begins no target; write node UUID or object TYPE UUID");
    }
    target.uuid = parseUUIDFor(kindOf(target), rest.takeValue(group, "a UUID"));
    if (target.isObject && rest.atHint()) target.hint = parseUUIDFor("--hint", rest.take());
    targets.push_back(target);
  }
  return targets;
}

std::vector<Target> allTargets(const host::Directory &directory) {
  std::vector<Target> targets;
  for (const host::Entry &entry : directory.entries(KARST_TYPE_NODE)) {
    targets.push_back({.uuid = entry.uuid});
  }
  for (unsigned type = 0; type <= UINT8_MAX; type++) {
    if (isReserved(static_cast<uint8_t>(type))) continue;
    for (const host::Entry &entry : directory.entries(static_cast<uint8_t>(type))) {
      targets.push_back({.type = entry.type, .uuid = entry.uuid, .isObject = true});
    }
  }
  return targets;
}

}  // namespace cli
