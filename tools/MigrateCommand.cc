// stowline migrate: the migration host. It loads the plug-in, makes its
// migrator, shows the estimate, runs performMigration while a progress bar
// follows migrationProgress (on a terminal only), and prints a summary.
//
// Everything the user can fix is checked before anything changes: the root,
// the migration markers of the old layout, the log file, the plug-in and its
// entry points. Only then is the registry opened and the migrator made (its
// init may already delete an empty old container root: that is the
// migration's own work).

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "AppMigrator/Classification.h"
#include "AppMigrator/OldLayout.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/HostLog.h"
#include "Platform/InstallerLibrary.h"
#include "Platform/InstallerLog.h"
#include "Platform/MigrationHost.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "Registry/EmbeddedRegistry.h"
#include "Support/Log.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"
#include "tools/Json.h"

namespace stowline {

namespace {

constexpr char kCommand[] = "migrate";

constexpr char kHelp[] =
    "usage: stowline migrate [--root DIR] [--plugin PATH] [--log-file FILE]\n"
    "                        [--log-format text|jsonl] [--log-level error|notice|debug]\n"
    "                        [--json] [--no-progress] [--trust-markers]\n"
    "\n"
    "Loads the migration plug-in and migrates the old layout below the root into\n"
    "the new one.\n"
    "\n"
    "  --root DIR          the system root (default: $STOWLINE_ROOT, else /)\n"
    "  --plugin PATH       the plug-in to load (default: the one installed beside\n"
    "                      the program, else the one of the build tree)\n"
    "  --log-file FILE     append the log lines to FILE (errors also go to\n"
    "                      standard error); without it they go to standard error\n"
    "  --log-format FMT    text (default) or jsonl\n"
    "  --log-level LEVEL   error, notice (default) or debug\n"
    "  --json              print the summary as one JSON object\n"
    "  --no-progress       no progress bar, even on a terminal\n"
    "  --trust-markers     use the migration markers of the old layout as they\n"
    "                      stand, even those that name a container outside the old\n"
    "                      container root or a bundle outside their container\n"
    "\n"
    "Exit status: 0 when the migration succeeded, 1 when it failed, 2 for a usage\n"
    "error, a migration marker that names paths outside the old layout, a plug-in\n"
    "that cannot be loaded, a log file that cannot be opened or a migrator that\n"
    "could not be made.\n";

// The estimated duration is 20 plus 2.25 per item of the old container root.
constexpr double kBaseDuration = 20.0;
constexpr double kDurationPerItem = 2.25;

struct Options {
  std::string root;
  std::string plugin;
  std::string logFile;
  bool jsonl = false;
  int logLevel = sl::kLogLevelNotice;
  bool json = false;
  bool noProgress = false;
  bool trustMarkers = false;
};

// Parses the options; nullopt with the exit status in `status` when the
// command must stop (a usage error, or --help).
std::optional<Options> parse(Arguments args, int* status) {
  Options options;
  const auto logFormat = [&](std::string_view text) {
    if (text != "text" && text != "jsonl") return "unknown log format '" + std::string(text) + "' (text or jsonl)";
    options.jsonl = text == "jsonl";
    return std::string();
  };
  const auto logLevel = [&](std::string_view text) {
    if (text == "error") {
      options.logLevel = sl::kLogLevelError;
    } else if (text == "notice") {
      options.logLevel = sl::kLogLevelNotice;
    } else if (text == "debug") {
      options.logLevel = sl::kLogLevelDebug;
    } else {
      return "unknown log level '" + std::string(text) + "' (error, notice or debug)";
    }
    return std::string();
  };
  CommandLine line(kCommand, kHelp);
  line.value("--root", "a directory", &options.root)
      .value("--plugin", "a file", &options.plugin)
      .value("--log-file", "a file", &options.logFile)
      .value("--log-format", "text or jsonl", logFormat)
      .value("--log-level", "error, notice or debug", logLevel)
      .flag("--json", &options.json)
      .flag("--no-progress", &options.noProgress)
      .flag("--trust-markers", &options.trustMarkers);
  if (std::optional<int> stop = line.parse(args)) {
    *status = *stop;
    return std::nullopt;
  }
  return options;
}

// The plug-in beside the installed program (BINDIR/../LIBDIR/stowline/), else
// the one the build made.
std::string defaultPluginPath() {
  char self[PATH_MAX];
  const ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
  if (n > 0) {
    std::string dir(self, static_cast<size_t>(n));
    dir.erase(dir.rfind('/'));
    const std::string installed = dir + "/../" SL_INSTALL_PLUGIN_DIR "/" SL_PLUGIN_FILE_NAME;
    if (::access(installed.c_str(), F_OK) == 0) return installed;
  }
  return SL_BUILD_PLUGIN_PATH;
}

// "2024-05-01T12:34:56.789Z"
std::string isoTime() {
  const auto now = std::chrono::system_clock::now();
  const std::time_t seconds = std::chrono::system_clock::to_time_t(now);
  const auto millis =
      std::chrono::duration_cast<std::chrono::milliseconds>(now.time_since_epoch()).count() % 1000;
  std::tm tm{};
  ::gmtime_r(&seconds, &tm);
  char buffer[96];
  std::snprintf(buffer, sizeof buffer, "%04d-%02d-%02dT%02d:%02d:%02d.%03dZ", tm.tm_year + 1900, tm.tm_mon + 1,
                tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, static_cast<int>(millis));
  return buffer;
}

void writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t n = ::write(fd, bytes.data(), bytes.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return;  // a failed log write is not reported
    }
    bytes.remove_prefix(static_cast<size_t>(n));
  }
}

// Standard error is shared by the log lines and the progress bar: whoever
// writes holds the lock, and a log line first wipes the bar (the next tick
// draws it again).
class Terminal {
 public:
  std::mutex& lock() { return mutex_; }
  // Under lock(): the bar's current width, 0 when none is shown.
  size_t& barWidth() { return barWidth_; }

  void writeLine(std::string_view line) {
    std::lock_guard guard(mutex_);
    clearBarLocked();
    writeAll(STDERR_FILENO, line);
  }
  void clearBarLocked() {
    if (barWidth_ == 0) return;
    std::string blank(barWidth_ + 2, ' ');
    blank.front() = blank.back() = '\r';
    writeAll(STDERR_FILENO, blank);
    barWidth_ = 0;
  }

 private:
  std::mutex mutex_;
  size_t barWidth_ = 0;
};

// The sink of both logs: the wanted lines go to the log file (or to standard
// error without one), errors to standard error as well.
class LogWriter {
 public:
  LogWriter(const Options& options, sl::UniqueFd file, Terminal& terminal)
      : jsonl_(options.jsonl), level_(options.logLevel), file_(std::move(file)), terminal_(terminal) {}

  void write(const sl::LogRecord& record) {
    std::lock_guard guard(mutex_);  // the two logs deliver from their own locks
    const bool wanted = record.level <= level_;
    const bool error = record.level <= sl::kLogLevelError;
    if (file_) {
      if (wanted) writeAll(file_.get(), format(record, jsonl_, true));
      if (error) terminal_.writeLine(format(record, false, false));
    } else if (wanted) {
      terminal_.writeLine(format(record, jsonl_, true));
    }
  }

 private:
  // The text layout, with or without the time in front, or one JSON object.
  // A text record is one line whatever its message holds: a line break in a
  // name is written as "\n" (or "\r"), so no name can forge a line.
  static std::string format(const sl::LogRecord& record, bool jsonl, bool withTime) {
    if (!jsonl) {
      std::string line = withTime ? isoTime() + " " : std::string();
      line.append(sl::logLevelName(record.level)).append(" ").append(record.category);
      line.append(" ").append(record.function).append(": ");
      for (const char c : record.message) {
        if (c == '\n') {
          line.append("\\n");
        } else if (c == '\r') {
          line.append("\\r");
        } else {
          line.push_back(c);
        }
      }
      line.append("\n");
      return line;
    }
    JsonWriter json;
    json.beginObject();
    json.key("time").string(isoTime());
    json.key("level").number(int64_t{record.level});
    json.key("category").string(record.category);
    json.key("function").string(record.function);
    json.key("file").string(record.file);
    json.key("line").number(int64_t{record.line});
    json.key("message").string(record.message);
    json.endObject();
    return json.str() + "\n";
  }

  std::mutex mutex_;
  const bool jsonl_;
  const int level_;
  sl::UniqueFd file_;
  Terminal& terminal_;
};

// Points both logs at a writer while it lives; the default sinks come back
// when it ends, so no log call outlives the writer.
class ScopedLogSinks {
 public:
  explicit ScopedLogSinks(LogWriter& writer) {
    previousHost_ = sl::setHostLogSink([&writer](const sl::LogRecord& r) { writer.write(r); });
    previousInstaller_ = sl::setInstallerLogSink([&writer](const sl::LogRecord& r) { writer.write(r); });
  }
  ~ScopedLogSinks() {
    sl::setHostLogSink(std::move(previousHost_));
    sl::setInstallerLogSink(std::move(previousInstaller_));
  }
  ScopedLogSinks(const ScopedLogSinks&) = delete;
  ScopedLogSinks& operator=(const ScopedLogSinks&) = delete;

 private:
  sl::LogSink previousHost_;
  sl::LogSink previousInstaller_;
};

// A thread that redraws one line on standard error every 100 ms with the
// migrator's progress, until it is stopped. The line is redrawn with a
// carriage return and padded with blanks: no escape codes.
class ProgressBar {
 public:
  ProgressBar(DataClassMigrator& migrator, uint64_t items, Terminal& terminal)
      : migrator_(migrator), items_(items), terminal_(terminal), thread_([this] { run(); }) {}
  ~ProgressBar() { stop(); }
  ProgressBar(const ProgressBar&) = delete;
  ProgressBar& operator=(const ProgressBar&) = delete;

  void stop() {
    {
      std::lock_guard guard(mutex_);
      stopping_ = true;
    }
    wake_.notify_all();
    if (thread_.joinable()) thread_.join();
    std::lock_guard guard(terminal_.lock());
    terminal_.clearBarLocked();
  }

 private:
  void run() {
    std::unique_lock lock(mutex_);
    while (!stopping_) {
      draw(migrator_.migrationProgress());
      wake_.wait_for(lock, std::chrono::milliseconds(100), [this] { return stopping_; });
    }
  }

  void draw(float progress) {
    constexpr int kWidth = 30;
    const double fraction = std::clamp(static_cast<double>(progress), 0.0, 1.0);
    const int filled = static_cast<int>(fraction * kWidth);
    const auto done = static_cast<uint64_t>(std::llround(fraction * static_cast<double>(items_)));
    std::string line = "[";
    line.append(static_cast<size_t>(filled), '#');
    line.append(static_cast<size_t>(kWidth - filled), '-');
    line += "] ";
    char figures[64];
    std::snprintf(figures, sizeof figures, "%3d%%  %llu/%llu items", static_cast<int>(fraction * 100.0),
                  static_cast<unsigned long long>(done), static_cast<unsigned long long>(items_));
    line += figures;
    std::lock_guard guard(terminal_.lock());
    size_t& width = terminal_.barWidth();
    const size_t shown = std::max(width, line.size());
    line.resize(shown, ' ');  // blank out the rest of a longer previous line
    writeAll(STDERR_FILENO, "\r" + line);
    width = shown;
  }

  DataClassMigrator& migrator_;
  const uint64_t items_;
  Terminal& terminal_;
  std::mutex mutex_;
  std::condition_variable wake_;
  bool stopping_ = false;
  std::thread thread_;  // last: starts once everything above is ready
};

// The default workspace and installer library for the life of the scope.
class ScopedRegistry {
 public:
  explicit ScopedRegistry(std::shared_ptr<EmbeddedRegistry> registry) : registry_(std::move(registry)) {
    RGApplicationWorkspace::setDefaultWorkspace(registry_);
    SLInstallerLibrary::setDefaultLibrary(registry_);
  }
  ~ScopedRegistry() {
    RGApplicationWorkspace::setDefaultWorkspace(nullptr);
    SLInstallerLibrary::setDefaultLibrary(nullptr);
  }
  ScopedRegistry(const ScopedRegistry&) = delete;
  ScopedRegistry& operator=(const ScopedRegistry&) = delete;

 private:
  std::shared_ptr<EmbeddedRegistry> registry_;
};

// The number of items of the old container root, recovered from the
// estimate (20 + 2.25 per item): the host interface offers no count.
uint64_t itemsFromEstimate(float estimate) {
  const double items = (static_cast<double>(estimate) - kBaseDuration) / kDurationPerItem;
  if (!std::isfinite(items) || items < 0.5) return 0;
  return static_cast<uint64_t>(std::llround(items));
}

// Items dealt with, from the progress (the share of the items dealt with).
uint64_t itemsFromProgress(float progress, uint64_t items) {
  if (items == 0 || !(progress > 0.0f)) return 0;
  const double share = std::min(static_cast<double>(progress), 1.0);
  return static_cast<uint64_t>(std::llround(share * static_cast<double>(items)));
}

// True when `item` names an entry directly inside `directory`: its parent
// is that directory and its name is an ordinary one. Paths are compared as
// written, as introspection writes them.
bool isDirectChild(const sl::URL& item, const sl::URL& directory) {
  if (item.isNull() || directory.isNull()) return false;
  const std::string name = item.lastPathComponent();
  if (name.empty() || name == "." || name == ".." || name == "/") return false;
  return item.URLByDeletingLastPathComponent().path() == directory.path();
}

// The findings for every migration marker that introspection would take as
// its container's record, in the order of the old container root's listing.
// Only directories that hold something at the marker's name are classified;
// links in the root are left out, as the migrator leaves them out (and the
// listing that leaves them out would log each one). A root that is missing
// or cannot be listed gives none: the migrator's init reports it.
std::vector<MarkerFinding> untrustedMarkers() {
  std::vector<MarkerFinding> findings;
  const sl::URL containerRoot = SLGlobalConfiguration::sharedInstance().oldContainerPath();
  const std::optional<std::vector<sl::URL>> entries =
      SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(containerRoot, false, nullptr);
  if (!entries) return findings;
  for (const sl::URL& entry : *entries) {
    struct stat st;
    if (::lstat(entry.fileSystemRepresentation(), &st) != 0 || !S_ISDIR(st.st_mode)) continue;
    const sl::URL marker = entry.URLByAppendingPathComponent(sl::migrator::kMigrationMarkerName, false);
    if (::lstat(marker.fileSystemRepresentation(), &st) != 0) continue;
    const sl::migrator::Decision decision = sl::migrator::classifyContainer(entry);
    if (decision.kind != sl::migrator::DecisionKind::MarkerFound) continue;
    if (std::optional<MarkerFinding> finding = checkMarkerRecord(decision.record, marker, containerRoot)) {
      findings.push_back(std::move(*finding));
    }
  }
  return findings;
}

bool wantsProgressBar(const Options& options) {
  if (options.noProgress || !::isatty(STDERR_FILENO)) return false;
  const char* noColor = std::getenv("NO_COLOR");
  return noColor == nullptr || noColor[0] == '\0';
}

}  // namespace

std::optional<MarkerFinding> checkMarkerRecord(const sl::Dictionary& record, const sl::URL& marker,
                                               const sl::URL& containerRoot) {
  const auto pathOf = [&record](const char* key) {
    const sl::String value = record.get(key).asString();
    return value.isNull() ? std::string() : value.str();
  };
  const auto finding = [&](const char* key, const sl::URL& within) {
    return MarkerFinding{marker.path(), key, pathOf(key), within.path()};
  };
  const sl::URL container = sl::URL::fileURLWithPath(pathOf(sl::migrator::kContainerPathKey), true);
  struct stat st;
  if (!isDirectChild(container, containerRoot) || ::lstat(container.fileSystemRepresentation(), &st) != 0 ||
      !S_ISDIR(st.st_mode)) {
    return finding(sl::migrator::kContainerPathKey, containerRoot);
  }
  // Bundles need not exist: a resumed run may have moved them away already.
  for (const char* key : {sl::migrator::kBundlePathKey, sl::migrator::kSecondBundlePathKey}) {
    if (std::string_view(key) == sl::migrator::kSecondBundlePathKey && !record.contains(key)) continue;
    if (!isDirectChild(sl::URL::fileURLWithPath(pathOf(key), true), container)) return finding(key, container);
  }
  return std::nullopt;
}

std::string describeMarkerFinding(const MarkerFinding& finding) {
  const bool isContainer = finding.key == sl::migrator::kContainerPathKey;
  return "migration marker " + finding.marker + " names \"" + finding.key + "\" " + finding.path + ", which is not " +
         (isContainer ? "a directory directly inside the old container root " : "directly inside its container ") +
         finding.within;
}

int migrateCommand(Arguments args) {
  int status = 0;
  const std::optional<Options> parsed = parse(args, &status);
  if (!parsed) return status;
  const Options& options = *parsed;

  // 1. The root: it must be a directory (also when it comes from
  //    STOWLINE_ROOT or is "/").
  if (!applyRoot(kCommand, options.root)) return 2;

  // 2. The migration markers. The plug-in acts on a marker's paths as they
  //    stand; one that leads outside the old layout stops the run here,
  //    before anything is written.
  if (!options.trustMarkers) {
    const std::vector<MarkerFinding> findings = untrustedMarkers();
    if (!findings.empty()) {
      std::string message = describeMarkerFinding(findings.front());
      if (findings.size() > 1) {
        const size_t more = findings.size() - 1;
        message += "; " + std::to_string(more) + (more == 1 ? " more marker names" : " more markers name") +
                   " paths outside the old layout";
      }
      return setupError(kCommand, message + "; nothing was changed (--trust-markers uses markers as they stand)");
    }
  }

  // 3. The log file, opened for appending.
  sl::UniqueFd logFile;
  if (!options.logFile.empty()) {
    logFile.reset(::open(options.logFile.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
    const int openErrno = errno;
    if (!logFile) return setupError(kCommand, "cannot open log file " + options.logFile + ": " + std::strerror(openErrno));
  }

  // 4. The plug-in and its two entry points. It stays loaded until the
  //    process ends.
  const std::string pluginPath = options.plugin.empty() ? defaultPluginPath() : options.plugin;
  void* plugin = ::dlopen(pluginPath.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (plugin == nullptr) return setupError(kCommand, std::string("cannot load the plug-in: ") + ::dlerror());
  const auto create = reinterpret_cast<DataClassMigratorCreateFunction>(::dlsym(plugin, kDataClassMigratorEntryPoint));
  if (create == nullptr) return setupError(kCommand, std::string("not a migration plug-in: ") + ::dlerror());
  const auto release =
      reinterpret_cast<DataClassMigratorReleaseFunction>(::dlsym(plugin, kDataClassMigratorReleasePoint));
  if (release == nullptr) return setupError(kCommand, std::string("not a migration plug-in: ") + ::dlerror());

  // 5. The logs. The installer log's call sites filter by the handle's
  //    threshold (debug lines need one); the host log is filtered here.
  static sl::InstallerLogHandle handle;
  handle.threshold = options.logLevel;
  gLogHandle = &handle;
  Terminal terminal;
  LogWriter writer(options, std::move(logFile), terminal);
  ScopedLogSinks sinks(writer);

  // 6. The registry of the root, as the default workspace and library.
  sl::Error error;
  std::shared_ptr<EmbeddedRegistry> registry = EmbeddedRegistry::open(SLGlobalConfiguration::sharedInstance(), &error);
  if (!registry) return setupError(kCommand, "cannot open the registry: " + error.description());
  ScopedRegistry defaults(std::move(registry));

  // 7. The migrator; its init loads the start-up state.
  const auto releaseMigrator = [release](DataClassMigrator* m) { release(m); };
  std::unique_ptr<DataClassMigrator, decltype(releaseMigrator)> migrator(create(), releaseMigrator);
  if (!migrator) return setupError(kCommand, "the plug-in made no migrator (its init failed)");

  const float estimate = migrator->estimatedDuration();
  const uint64_t items = itemsFromEstimate(estimate);
  if (!options.json) {
    std::printf("Plug-in: %s\n", pluginPath.c_str());
    std::printf("%llu item%s to migrate, estimated duration %.2f\n", static_cast<unsigned long long>(items),
                items == 1 ? "" : "s", static_cast<double>(estimate));
    std::fflush(stdout);
  }

  const auto start = std::chrono::steady_clock::now();
  bool result;
  {
    std::optional<ProgressBar> bar;
    if (items > 0 && wantsProgressBar(options)) bar.emplace(*migrator, items, terminal);
    result = migrator->performMigration();
  }
  const double elapsed = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  const uint64_t migrated = itemsFromProgress(migrator->migrationProgress(), items);

  if (options.json) {
    JsonWriter json;
    json.beginObject();
    json.key("result").boolean(result);
    json.key("itemsToMigrate").number(items);
    json.key("itemsMigrated").number(migrated);
    json.key("estimatedDuration").number(static_cast<double>(estimate));
    json.key("elapsedSeconds").number(std::round(elapsed * 1000.0) / 1000.0);
    json.endObject();
    std::printf("%s\n", json.str().c_str());
  } else {
    std::printf("Migrated %llu of %llu item%s in %.2f s: %s\n", static_cast<unsigned long long>(migrated),
                static_cast<unsigned long long>(items), items == 1 ? "" : "s", elapsed,
                result ? "success" : "failed");
  }
  return result ? 0 : 1;
}

}  // namespace stowline
