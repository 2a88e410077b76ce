// stowline: runs the application-migration plug-in on a directory tree, and
// shows and prepares what it works on.

#include <cstdio>
#include <cstring>
#include <string_view>

#include "tools/Commands.h"

namespace {

constexpr char kUsage[] =
    "usage: stowline <command> [options]\n"
    "\n"
    "commands:\n"
    "  migrate    run the migration of the old layout into the new one\n"
    "  plan       show what migrate would do, changing nothing\n"
    "  registry   show and drive the embedded application registry\n"
    "  fixture    write a sample old layout\n"
    "  digest     print the SHA-256 of files\n"
    "  config     print the settings and every path of the configuration\n"
    "  manifest   record every user-data item of the old layout as JSON\n"
    "  verify     check a migrated layout against a manifest\n"
    "\n"
    "Run 'stowline <command> --help' for a command's options.\n";

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) {
    std::fputs(kUsage, stderr);
    return 2;
  }
  std::string_view command = argv[1];
  stowline::Arguments args(argv + 2, static_cast<size_t>(argc - 2));
  if (command == "--help" || command == "-h" || command == "help") {
    std::fputs(kUsage, stdout);
    return 0;
  }
  if (command == "--version") {
    std::printf("stowline %s\n", stowline::kVersion);
    return 0;
  }
  if (command == "migrate") return stowline::migrateCommand(args);
  if (command == "plan") return stowline::planCommand(args);
  if (command == "registry") return stowline::registryCommand(args);
  if (command == "fixture") return stowline::fixtureCommand(args);
  if (command == "digest") return stowline::digestCommand(args);
  if (command == "config") return stowline::configCommand(args);
  if (command == "manifest") return stowline::manifestCommand(args);
  if (command == "verify") return stowline::verifyCommand(args);
  std::fprintf(stderr, "stowline: unknown command '%s'\n%s", argv[1], kUsage);
  return 2;
}
