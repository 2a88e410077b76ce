#include "Platform/ProcessServices.h"

#include <cxxabi.h>
#include <execinfo.h>
#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <thread>
#include <utility>

namespace sl {

// ---- CPU-usage monitor ----

namespace {
std::atomic<bool> gCpuMonitorEnabled{true};

// Only the own process can be addressed; any other pid is a process this one
// has no monitor for.
bool isOwnProcess(pid_t pid) {
  if (pid == getpid()) return true;
  errno = ESRCH;
  return false;
}
}  // namespace

int proc_disable_cpumon(pid_t pid) {
  if (!isOwnProcess(pid)) return -1;
  gCpuMonitorEnabled.store(false);
  return 0;
}

int proc_set_cpumon_defaults(pid_t pid) {
  if (!isOwnProcess(pid)) return -1;
  gCpuMonitorEnabled.store(true);
  return 0;
}

bool cpuMonitorIsEnabled() { return gCpuMonitorEnabled.load(); }

// ---- Process transactions ----

namespace {
std::atomic<int64_t> gOpenTransactions{0};
}  // namespace

void processTransactionBegin() { gOpenTransactions.fetch_add(1); }

void processTransactionEnd() {
  // An unmatched end is dropped rather than letting the count go negative,
  // which would hide the next begin.
  int64_t open = gOpenTransactions.load();
  while (open > 0 && !gOpenTransactions.compare_exchange_weak(open, open - 1)) {
  }
}

int64_t openProcessTransactions() { return gOpenTransactions.load(); }

// ---- Task queues ----

struct TaskQueue::State {
  std::string label;
  std::mutex mutex;
  std::condition_variable wake;
  std::deque<std::function<void()>> tasks;  // guarded by mutex
  bool stopping = false;                    // guarded by mutex
  std::thread worker;

  void run() {
    // A Linux thread name holds 15 bytes and a terminating zero; a longer
    // one is refused (ERANGE), so the label is cut to fit.
    std::string name = label.substr(0, 15);
    pthread_setname_np(pthread_self(), name.c_str());

    std::unique_lock lock(mutex);
    for (;;) {
      wake.wait(lock, [this] { return stopping || !tasks.empty(); });
      // Stopping still drains: the worker leaves only once nothing is queued.
      if (tasks.empty()) return;
      std::function<void()> task = std::move(tasks.front());
      tasks.pop_front();
      lock.unlock();
      task();
      // Whatever the task held (captures included) goes before the next one
      // starts, outside the lock.
      task = nullptr;
      lock.lock();
    }
  }
};

TaskQueue::TaskQueue(std::string label) : state_(std::make_unique<State>()) {
  state_->label = std::move(label);
  state_->worker = std::thread([state = state_.get()] { state->run(); });
}

TaskQueue::~TaskQueue() {
  {
    std::lock_guard lock(state_->mutex);
    state_->stopping = true;
  }
  state_->wake.notify_one();
  state_->worker.join();
}

void TaskQueue::async(std::function<void()> task) {
  {
    std::lock_guard lock(state_->mutex);
    state_->tasks.push_back(std::move(task));
  }
  state_->wake.notify_one();
}

const std::string& TaskQueue::label() const { return state_->label; }

// ---- Crash reporter record ----

// Kept even when nothing in the program refers to it: a crash reporter looks
// it up by name.
extern "C" {
[[gnu::used]] alignas(8) CrashReporterInfo gCRAnnotations = {5, nullptr, {0, 0, 0, 0, 0, 0}};
}

bool currentThreadName(std::string* name) {
  char buffer[16] = {};
  if (pthread_getname_np(pthread_self(), buffer, sizeof buffer) != 0) return false;
  if (name != nullptr) *name = buffer;
  return true;
}

// ---- Uncaught exceptions ----

namespace {

struct FreeDeleter {
  void operator()(void* p) const { std::free(p); }
};

std::string demangledName(const std::type_info* type) {
  if (type == nullptr) return std::string();
  int status = 0;
  std::unique_ptr<char, FreeDeleter> demangled(abi::__cxa_demangle(type->name(), nullptr, nullptr, &status));
  return status == 0 && demangled ? std::string(demangled.get()) : std::string(type->name());
}

}  // namespace

// Not inlined, so that the frame it leaves out of the stack is its own.
[[gnu::noinline]] ExceptionReport reportForException(std::exception_ptr exception) {
  ExceptionReport report;
  if (exception) {
    // The type of an exception object is known only to a handler that has
    // caught it: rethrow and ask inside the catch.
    try {
      std::rethrow_exception(exception);
    } catch (const std::exception& e) {
      report.name = demangledName(abi::__cxa_current_exception_type());
      report.hasReason = true;
      report.reason = e.what();
    } catch (...) {
      report.name = demangledName(abi::__cxa_current_exception_type());
    }
  }

  constexpr int kMaxFrames = 128;
  void* frames[kMaxFrames];
  int count = backtrace(frames, kMaxFrames);
  // One allocation holding the array and the strings it points to.
  std::unique_ptr<char*, FreeDeleter> symbols(backtrace_symbols(frames, count));
  if (symbols) {
    for (int i = 1; i < count; ++i) report.callStackSymbols.emplace_back(symbols.get()[i]);
  }
  return report;
}

namespace {

std::atomic<void (*)(const ExceptionReport&)> gUncaughtExceptionHandler{nullptr};

[[noreturn]] void terminateWithReport() {
  std::exception_ptr current = std::current_exception();
  void (*handler)(const ExceptionReport&) = gUncaughtExceptionHandler.load();
  if (current && handler != nullptr) handler(reportForException(current));
  std::abort();
}

}  // namespace

void installUncaughtExceptionHandler(void (*handler)(const ExceptionReport&)) {
  gUncaughtExceptionHandler.store(handler);
  std::set_terminate(terminateWithReport);
}

}  // namespace sl
