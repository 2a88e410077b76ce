// The stowline program's commands. Each takes the arguments after its name
// and returns the process's exit status: 0 for success, 1 when the work ran
// and failed (a migration that returned false, a digest that could not read
// a file), 2 for a usage error or anything the user must fix first.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "Platform/URL.h"
#include "Platform/Value.h"

namespace stowline {

using Arguments = std::span<char* const>;

int migrateCommand(Arguments args);
int planCommand(Arguments args);
int registryCommand(Arguments args);
int fixtureCommand(Arguments args);
int digestCommand(Arguments args);
int configCommand(Arguments args);
int manifestCommand(Arguments args);
int verifyCommand(Arguments args);

// "stowline <command>: <message>" and a hint at --help on standard error;
// returns 2. For mistakes in the command line itself.
int usageError(std::string_view command, std::string_view message);

// "stowline <command>: <message>", one line on standard error; returns 2.
// For what the user must fix outside the command line (a root that does not
// exist, a plug-in that cannot be loaded, a log file that cannot be opened).
int setupError(std::string_view command, std::string_view message);

// Sets the system root from --root before anything reads the
// configuration. The root in effect (--root, else STOWLINE_ROOT, else "/")
// must be an existing directory; otherwise a setup error is printed and the
// answer is false.
bool applyRoot(std::string_view command, const std::string& root);

// A migration marker of the old layout whose paths lie outside it. The
// plug-in acts on a marker's paths as they stand (it writes into, moves out
// of and finally removes its "ContainerPath"), so migrate checks every marker
// before it loads the plug-in, and plan shows what that check finds.
struct MarkerFinding {
  std::string marker;  // the marker file
  std::string key;     // "ContainerPath", "BundlePath" or "SecondBundlePath"
  std::string path;    // the path the marker names under that key
  std::string within;  // the directory that path must lie directly inside
};

// Checks the record read back from the marker at `marker`: its
// "ContainerPath" must be a directory (not a link) directly inside
// `containerRoot`, and "BundlePath" and "SecondBundlePath" (when present)
// must name entries directly inside that container. nullopt when they do.
// Defined in MigrateCommand.cc.
std::optional<MarkerFinding> checkMarkerRecord(const sl::Dictionary& record, const sl::URL& marker,
                                               const sl::URL& containerRoot);

// "migration marker M names "K" P, which is not ... inside W".
std::string describeMarkerFinding(const MarkerFinding& finding);

inline constexpr char kVersion[] = "0.1.0";

}  // namespace stowline
