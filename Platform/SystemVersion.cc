// The system-version dictionary on Linux: ROOT/etc/os-release.

#include "Platform/SystemVersion.h"

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

namespace sl {

namespace {

bool isBlank(char c) { return c == ' ' || c == '\t' || c == '\r'; }

bool isKeyCharacter(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '_';
}

// The value of one assignment's right-hand side; nothing when a quote is
// left open.
std::optional<std::string> parseValue(std::string_view text) {
  if (text.empty()) return std::string();
  const char quote = text.front();
  if (quote == '\'') {
    const size_t close = text.find('\'', 1);
    if (close == std::string_view::npos) return std::nullopt;
    return std::string(text.substr(1, close - 1));
  }
  if (quote == '"') {
    std::string value;
    for (size_t i = 1; i < text.size(); ++i) {
      const char c = text[i];
      if (c == '"') return value;
      if (c == '\\' && i + 1 < text.size()) {
        const char next = text[i + 1];
        if (next == '"' || next == '\\' || next == '$' || next == '`') {
          value += next;
          ++i;
          continue;
        }
      }
      value += c;
    }
    return std::nullopt;
  }
  while (!text.empty() && isBlank(text.back())) text.remove_suffix(1);
  return std::string(text);
}

std::map<std::string, std::string, std::less<>> parseAssignments(std::string_view text) {
  std::map<std::string, std::string, std::less<>> assignments;
  while (!text.empty()) {
    const size_t newline = text.find('\n');
    std::string_view line = text.substr(0, newline);
    text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);

    while (!line.empty() && isBlank(line.front())) line.remove_prefix(1);
    if (line.empty() || line.front() == '#') continue;
    const size_t equals = line.find('=');
    if (equals == 0 || equals == std::string_view::npos) continue;
    const std::string_view key = line.substr(0, equals);
    bool valid = true;
    for (char c : key) valid = valid && isKeyCharacter(c);
    if (!valid) continue;
    std::optional<std::string> value = parseValue(line.substr(equals + 1));
    if (value) assignments[std::string(key)] = std::move(*value);
  }
  return assignments;
}

}  // namespace

Dictionary copySystemVersionDictionary() {
  std::vector<uint8_t> bytes;
  const URL source = URL::fileURLWithPath(pathBelowSystemRoot("/etc/os-release"), false);
  if (!readFileContents(source, &bytes)) return nullptr;
  return parseOSRelease(std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
}

Dictionary parseOSRelease(std::string_view text) {
  const auto assignments = parseAssignments(text);

  auto lookup = [&assignments](std::string_view key) -> String {
    const auto it = assignments.find(key);
    if (it == assignments.end() || it->second.empty()) return nullptr;
    return String(it->second);
  };
  Dictionary version = Dictionary::create();
  version.set(kSystemProductNameKey, lookup("NAME"));  // a null value sets nothing
  version.set(kSystemProductVersionKey, lookup("VERSION_ID"));
  String build = lookup("BUILD_ID");
  version.set(kSystemBuildVersionKey, build.isNull() ? lookup("VERSION_ID") : build);
  return version;
}

}  // namespace sl
