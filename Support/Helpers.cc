#include "Support/Helpers.h"

#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>

#include "Platform/Format.h"

namespace {

// Whether `value` is of kind `cls` or of a kind derived from it. Booleans
// are numbers; nothing else derives, and a null handle is of no kind.
bool isKindOf(const sl::Value& value, sl::ValueKind cls) {
  if (value.isNull()) return false;
  if (value.kind() == cls) return true;
  return cls == sl::ValueKind::Number && value.kind() == sl::ValueKind::Boolean;
}

// Process-wide count of open high-resource-usage assertions.
std::atomic<int32_t> gResourceAssertionCount{0};

// Statically initialised and never destroyed or released: see
// SLCrashOnException.
pthread_mutex_t gCrashReportLock = PTHREAD_MUTEX_INITIALIZER;

void writeAll(int fd, const char* bytes, size_t length) {
  while (length > 0) {
    ssize_t n = ::write(fd, bytes, length);  // not counted: the crash report to stderr
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;  // nowhere else to report it
    bytes += n;
    length -= static_cast<size_t>(n);
  }
}

}  // namespace

sl::String SLStringifyObject(const sl::Value& object) {
  if (object.isNull()) return nullptr;
  if (object.kind() == sl::ValueKind::String) return object.asString();
  return sl::String(sl::format("%@", object));
}

bool SLArrayContainsOnlyClass(const sl::Array& array, sl::ValueKind cls) {
  for (const sl::Value& element : array) {
    if (!isKindOf(element, cls)) return false;
  }
  return true;
}

bool SLBooleanValue(const sl::Value& object, bool defaultValue) {
  switch (object.kind()) {
    case sl::ValueKind::Boolean:
      return object.asBoolean().boolValue();
    case sl::ValueKind::Number: {
      sl::Number number = object.asNumber();
      switch (number.type()) {
        case sl::Number::Type::Signed: return number.int64Value() != 0;
        case sl::Number::Type::Unsigned: return number.uint64Value() != 0;
        case sl::Number::Type::Real: return number.doubleValue() != 0.0;
      }
      return defaultValue;  // GCOVR_EXCL_LINE: every type returns above; this only quiets -Wreturn-type
    }
    default:
      return defaultValue;
  }
}

sl::Array SLArrayifyThing(const sl::Value& object, sl::ValueKind cls) {
  if (object.isNull()) return nullptr;
  if (object.kind() == sl::ValueKind::Array) {
    sl::Array array = object.asArray();
    return SLArrayContainsOnlyClass(array, cls) ? array : sl::Array(nullptr);
  }
  if (isKindOf(object, cls)) return sl::Array{object};
  // The value model has no set kind, so there is no unordered collection to
  // turn into an array: everything else is refused.
  return nullptr;
}

void SLAssertHighResourceUsage() {
  // Only the caller that opens the first assertion switches the monitor off.
  if (gResourceAssertionCount.fetch_add(1, std::memory_order_seq_cst) + 1 == 1) {
    sl::proc_disable_cpumon(getpid());
  }
}

void SLClearResourceAssertion() {
  // Only the caller that closes the last assertion restores the monitor.
  if (gResourceAssertionCount.fetch_sub(1, std::memory_order_seq_cst) - 1 == 0) {
    sl::proc_set_cpumon_defaults(getpid());
  }
}

void SLRunTransactionalTask(sl::TaskQueue& queue, std::function<void()> task) {
  // Opened here, before the task is queued, so the process cannot be ended
  // for being idle between this call and the moment the task starts.
  sl::processTransactionBegin();
  // The queued closure owns the task until it has run.
  queue.async([task = std::move(task)] {
    if (task) task();
    sl::processTransactionEnd();
  });
}

void SLCrashOnException(const sl::ExceptionReport& exception) {
  std::string text = "** INTERNAL ERROR: Uncaught Exception **\n";
  text += "Exception: ";
  std::string threadName;
  if (sl::currentThreadName(&threadName)) {
    text += "<";
    text += threadName;
    text += "> ";
  }
  if (!exception.name.empty()) {
    text += exception.name;
    text += ": ";
  }
  if (exception.hasReason) text += exception.reason;
  text += "\nStack:\n";
  for (size_t i = 0; i < exception.callStackSymbols.size(); ++i) {
    if (i > 0) text += "\n";
    text += exception.callStackSymbols[i];
  }

  // Never released: a second thread that crashes meanwhile waits here until
  // the first has ended the process, so only one report is written.
  pthread_mutex_lock(&gCrashReportLock);
  // Never freed: the crash reporter reads it from the dead process.
  char* message = strdup(text.c_str());
  sl::gCRAnnotations.message = message;
  writeAll(STDERR_FILENO, text.data(), text.size());
  writeAll(STDERR_FILENO, "\n", 1);
  std::abort();
}
