// Process-wide services: the CPU-usage monitor, process transactions,
// serial task queues, the crash reporter's record and the report of an
// uncaught exception.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <exception>
#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace sl {

// ---- CPU-usage monitor ----
// Linux enforces no CPU-usage limit on a process; the monitor is process-wide
// state (atomic, any thread may call) that can be switched off and back to
// its defaults, and queried. Only the own process can be addressed: both
// calls return 0 for getpid(), and -1 with errno ESRCH for any other pid,
// leaving the state alone. Calls do not nest; the last one wins.
int proc_disable_cpumon(pid_t pid);
int proc_set_cpumon_defaults(pid_t pid);
// Whether the monitor of the own process is on (its default).
bool cpuMonitorIsEnabled();

// ---- Process transactions ----
// While at least one transaction is open, the process is not ended for being
// idle. Begin and end nest and may be called from any thread; the count can
// be queried. An end without a matching begin is a caller's bug: it is
// ignored, so the count never goes below 0.
void processTransactionBegin();
void processTransactionEnd();
int64_t openProcessTransactions();

// ---- Task queues ----
// A serial queue backed by one worker thread, which is named after the label
// (cut to the 15 bytes a Linux thread name holds): tasks run one at a time,
// in the order they were submitted, never on the submitting thread. async()
// may be called from any thread, a task of this queue included. The
// destructor runs the tasks already submitted (and those they submit), then
// joins the worker; it must not run on the worker itself. A task that throws
// ends the process (std::terminate), as an exception escaping any thread
// does.
class TaskQueue {
 public:
  explicit TaskQueue(std::string label);
  ~TaskQueue();
  TaskQueue(const TaskQueue&) = delete;
  TaskQueue& operator=(const TaskQueue&) = delete;

  void async(std::function<void()> task);
  const std::string& label() const;

 private:
  struct State;
  std::unique_ptr<State> state_;
};

// ---- Crash reporter record ----
// A 64-byte, 8-aligned record in the library's data that a crash reporter
// reads from a crashed process: version 5 at offset 0, the address of a
// NUL-terminated message at offset 8 (null until a crash report is written),
// six further 8-byte fields that stay 0.
struct CrashReporterInfo {
  uint64_t version;
  const char* message;
  uint64_t reserved[6];
};
static_assert(sizeof(CrashReporterInfo) == 64 && alignof(CrashReporterInfo) == 8);
extern "C" CrashReporterInfo gCRAnnotations;

// The calling thread's name (at most 15 bytes on Linux, where every thread
// has one: a new thread inherits its creator's); false only when it cannot
// be read. An empty name is a name.
bool currentThreadName(std::string* name);

// ---- Uncaught exceptions ----
// The report of a C++ exception: name = the demangled type of the exception
// object ("std::runtime_error", "int"; empty when there is no exception),
// reason = what() for a std::exception (none otherwise), stack = the frames
// of the calling thread's stack, the caller's frame first, as
// backtrace_symbols gives them. Called from a terminate handler, that stack
// is the one that led to std::terminate.
struct ExceptionReport {
  std::string name;
  bool hasReason = false;
  std::string reason;
  std::vector<std::string> callStackSymbols;
};
ExceptionReport reportForException(std::exception_ptr exception);

// Installs, with std::set_terminate, a handler that hands the current
// exception's report to `handler` (which does not return). For programs that
// want it. When std::terminate is reached without an exception, or when
// `handler` returns after all, the process aborts.
void installUncaughtExceptionHandler(void (*handler)(const ExceptionReport&));

}  // namespace sl
