// The command line of one stowline command: the options it knows, where
// their values go, and whether it takes operands.
//
//   std::string root;
//   bool json = false;
//   CommandLine line(kCommand, kUsage);
//   line.value("--root", "a directory", &root).flag("--json", &json);
//   if (std::optional<int> status = line.parse(args)) return *status;
//
// parse() prints the usage text for --help and a usage error for anything
// it refuses ("stowline plan: --root needs a directory"), and answers the
// exit status; nullopt means the command goes on.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "tools/Commands.h"

namespace stowline {

class CommandLine {
 public:
  // Checks an option's value and stores it; answers the usage error's
  // message when the value is refused, else "".
  using Take = std::function<std::string(std::string_view value)>;

  CommandLine(std::string_view command, const char* usage) : command_(command), usage_(usage) {}

  // `name` sets *out.
  CommandLine& flag(std::string_view name, bool* out);
  // `name VALUE` stores VALUE in *out. A missing or empty VALUE is refused
  // with "<name> needs <what>".
  CommandLine& value(std::string_view name, std::string_view what, std::string* out);
  CommandLine& value(std::string_view name, std::string_view what, Take take);
  // Arguments that are not options, and every one after "--", go to *out
  // in order. Without this, the first one is refused.
  CommandLine& operands(std::vector<std::string>* out);

  std::optional<int> parse(Arguments args) const;

 private:
  struct Option {
    std::string_view name;
    std::string_view what;  // empty for a flag
    Take take;
  };

  std::string_view command_;
  const char* usage_;
  std::vector<Option> options_;
  std::vector<std::string>* operands_ = nullptr;
};

}  // namespace stowline
