#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <cstring>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "Support/Helpers.h"

namespace {

using sl::Array;
using sl::Boolean;
using sl::Number;
using sl::String;
using sl::ValueKind;

TEST(HelpersTest, ValueCoercions) {
  String name("Documents");
  EXPECT_EQ(SLStringifyObject(Number(42)), "42");
  EXPECT_EQ(SLStringifyObject(name).c_str(), name.c_str());  // the same node, not a copy
  EXPECT_TRUE(SLStringifyObject(nullptr).isNull());

  EXPECT_FALSE(SLBooleanValue(String("YES"), false));
  EXPECT_TRUE(SLBooleanValue(Number(2), false));
  EXPECT_FALSE(SLBooleanValue(Boolean(false), true));
  EXPECT_TRUE(SLBooleanValue(nullptr, true));
  // Every number type, the default never taken for a number.
  EXPECT_TRUE(SLBooleanValue(Number(uint64_t{1} << 63), false));
  EXPECT_FALSE(SLBooleanValue(Number(uint64_t{0}), true));
  EXPECT_TRUE(SLBooleanValue(Number(0.25), false));
  EXPECT_FALSE(SLBooleanValue(Number(-0.0), true));

  // Booleans are numbers; nothing else derives.
  EXPECT_TRUE(SLArrayContainsOnlyClass(Array{Number(1), Boolean(true)}, ValueKind::Number));
  EXPECT_FALSE(SLArrayContainsOnlyClass(Array{Number(1)}, ValueKind::Boolean));
  EXPECT_FALSE(SLArrayContainsOnlyClass(Array{name, nullptr}, ValueKind::String));

  EXPECT_EQ(SLArrayifyThing(name, ValueKind::String), (Array{name}));
  EXPECT_EQ(SLArrayifyThing(Boolean(true), ValueKind::Number), (Array{Boolean(true)}));
  EXPECT_TRUE(SLArrayifyThing(Number(1), ValueKind::String).isNull());
  EXPECT_TRUE(SLArrayifyThing(nullptr, ValueKind::String).isNull());
  EXPECT_TRUE(SLArrayifyThing(Array{name, Number(1)}, ValueKind::String).isNull());
  Array empty = SLArrayifyThing(Array::create(), ValueKind::String);
  EXPECT_TRUE(!empty.isNull() && empty.isEmpty());
  // Asked for arrays, an array is a list of arrays, not one item.
  EXPECT_EQ(SLArrayifyThing(Array{Array{name}}, ValueKind::Array), (Array{Array{name}}));
}

TEST(HelpersTest, ResourceAssertionsNest) {
  ASSERT_TRUE(sl::cpuMonitorIsEnabled());
  SLAssertHighResourceUsage();
  SLAssertHighResourceUsage();
  SLClearResourceAssertion();
  EXPECT_FALSE(sl::cpuMonitorIsEnabled());
  SLClearResourceAssertion();
  EXPECT_TRUE(sl::cpuMonitorIsEnabled());
}

TEST(HelpersTest, TransactionalTasksRunInOrderInsideTheirTransactions) {
  std::vector<int64_t> openDuring;
  std::promise<void> gate;
  auto token = std::make_shared<int>(0);
  std::weak_ptr<int> watch = token;
  {
    sl::TaskQueue queue("transactions");
    queue.async([ready = gate.get_future().share()] { ready.wait(); });
    for (int i = 1; i <= 3; ++i) {
      SLRunTransactionalTask(queue, [&, token] { openDuring.push_back(sl::openProcessTransactions()); });
    }
    // An empty task still opens its transaction and ends it.
    SLRunTransactionalTask(queue, nullptr);
    token.reset();
    // Opened by the calls themselves while the tasks wait; the queued tasks
    // keep what they captured alive.
    EXPECT_EQ(sl::openProcessTransactions(), 4);
    EXPECT_FALSE(watch.expired());
    gate.set_value();
  }
  // In order, each inside its own transaction and those queued after it.
  EXPECT_EQ(openDuring, (std::vector<int64_t>{4, 3, 2}));
  EXPECT_EQ(sl::openProcessTransactions(), 0);
  EXPECT_TRUE(watch.expired());
}

// Linked into the programs of the coverage build only (its preset asks for
// it): they write their counters at exit, which an abort skips.
extern "C" void __gcov_dump() __attribute__((weak));

// In the dying child, the crash record's message follows the report on
// standard error; the abort then goes on.
void writeCrashRecord(int) {
  if (const char* message = sl::gCRAnnotations.message) (void)!write(STDERR_FILENO, message, strlen(message));
  if (__gcov_dump != nullptr) __gcov_dump();
}

// A pattern that matches exactly `text`, and nothing else.
std::string exactly(const std::string& text) {
  std::string pattern = "^";
  for (char c : text) pattern += std::strchr("\\^$.|?*+()[]{}", c) != nullptr ? std::string{'\\', c} : std::string{c};
  return pattern + "$";
}

TEST(HelpersTest, CrashOnExceptionWritesTheReportAndAborts) {
  const struct {
    const char* threadName;
    sl::ExceptionReport report;
    std::string expected;
  } cases[] = {
      {"T",
       {"X", true, "Y", {"f1", "f2"}},
       "** INTERNAL ERROR: Uncaught Exception **\nException: <T> X: Y\nStack:\nf1\nf2"},
      // An empty thread name is still a name; no exception name, no reason.
      {"", {"", false, "", {}}, "** INTERNAL ERROR: Uncaught Exception **\nException: <> \nStack:\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.expected);
    EXPECT_EXIT(
        {
          signal(SIGABRT, writeCrashRecord);
          pthread_setname_np(pthread_self(), c.threadName);
          SLCrashOnException(c.report);
        },
        ::testing::KilledBySignal(SIGABRT), exactly(c.expected + "\n" + c.expected));
  }
}

}  // namespace
