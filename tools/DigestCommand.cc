// stowline digest FILE...: the SHA-256 of each file, in the layout of
// sha256sum ("<64 hex digits>  <path>"), through the system's own digest
// function. A file that cannot be read gets one line on standard error and
// the others are still digested; the exit status is then 1.

#include <cstdio>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/InstallerLog.h"
#include "Platform/URL.h"
#include "Support/Digest.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"

namespace stowline {

namespace {

constexpr char kHelp[] =
    "usage: stowline digest FILE...\n"
    "\n"
    "Prints the SHA-256 digest of each file as sha256sum does: 64 lowercase\n"
    "hexadecimal digits, two blanks and the path. '--' ends the options.\n"
    "\n"
    "Exit status: 0 when every file was read, 1 when some could not be, 2 for a\n"
    "usage error.\n";

// sha256sum's form of a name that holds a backslash or a line feed: the line
// starts with a backslash and both are escaped.
std::string line(const std::string& digest, std::string_view path) {
  if (path.find_first_of("\\\n") == std::string_view::npos) return digest + "  " + std::string(path) + "\n";
  std::string escaped;
  for (char c : path) {
    if (c == '\\')
      escaped += "\\\\";
    else if (c == '\n')
      escaped += "\\n";
    else
      escaped += c;
  }
  return "\\" + digest + "  " + escaped + "\n";
}

}  // namespace

int digestCommand(Arguments args) {
  std::vector<std::string> files;
  if (std::optional<int> status = CommandLine("digest", kHelp).operands(&files).parse(args)) return *status;
  if (files.empty()) return usageError("digest", "no file given");

  // The digest explains a failure in the installer log: keep the reader's
  // own line (the first) for the one line this command prints.
  std::vector<std::string> messages;
  sl::LogSink previous = sl::setInstallerLogSink([&messages](const sl::LogRecord& record) {
    messages.emplace_back(record.message);
  });
  int status = 0;
  for (std::string_view file : files) {
    messages.clear();
    const sl::String digest = SLCreateSHA256Digest(sl::URL::fileURLWithPath(file, false));
    if (digest.isNull()) {
      std::fflush(stdout);  // keep the order of the two streams
      std::fprintf(stderr, "stowline digest: %s\n",
                   messages.empty() ? ("cannot read " + std::string(file)).c_str() : messages.front().c_str());
      status = 1;
      continue;
    }
    const std::string text = line(digest.str(), file);
    std::fwrite(text.data(), 1, text.size(), stdout);
  }
  sl::setInstallerLogSink(std::move(previous));
  return status;
}

}  // namespace stowline
