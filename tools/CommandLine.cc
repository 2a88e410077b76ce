#include "tools/CommandLine.h"

#include <algorithm>
#include <cstdio>

namespace stowline {

CommandLine& CommandLine::flag(std::string_view name, bool* out) {
  options_.push_back({name, {}, [out](std::string_view) {
                        *out = true;
                        return std::string();
                      }});
  return *this;
}

CommandLine& CommandLine::value(std::string_view name, std::string_view what, std::string* out) {
  return value(name, what, [out](std::string_view value) {
    *out = value;
    return std::string();
  });
}

CommandLine& CommandLine::value(std::string_view name, std::string_view what, Take take) {
  options_.push_back({name, what, std::move(take)});
  return *this;
}

CommandLine& CommandLine::operands(std::vector<std::string>* out) {
  operands_ = out;
  return *this;
}

std::optional<int> CommandLine::parse(Arguments args) const {
  bool optionsEnded = false;
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string_view arg = args[i];
    const bool isOption = !optionsEnded && arg.size() > 1 && arg[0] == '-';
    if (!isOption) {
      if (operands_ == nullptr) return usageError(command_, "unexpected argument '" + std::string(arg) + "'");
      operands_->emplace_back(arg);
      continue;
    }
    if (arg == "--" && operands_ != nullptr) {
      optionsEnded = true;
      continue;
    }
    if (arg == "--help" || arg == "-h") {
      std::fputs(usage_, stdout);
      return 0;
    }
    const auto option = std::find_if(options_.begin(), options_.end(), [&](const Option& o) { return o.name == arg; });
    if (option == options_.end()) return usageError(command_, "unknown option '" + std::string(arg) + "'");
    std::string_view value;
    if (!option->what.empty()) {
      if (i + 1 >= args.size() || args[i + 1][0] == '\0') {
        return usageError(command_, std::string(arg) + " needs " + std::string(option->what));
      }
      value = args[++i];
    }
    if (const std::string refusal = option->take(value); !refusal.empty()) return usageError(command_, refusal);
  }
  return std::nullopt;
}

}  // namespace stowline
