#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <future>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/ProcessServices.h"

namespace {

TEST(ProcessServicesTest, MonitorAddressesOnlyTheOwnProcess) {
  errno = 0;
  EXPECT_EQ(sl::proc_disable_cpumon(getpid() + 1), -1);
  EXPECT_EQ(errno, ESRCH);
  EXPECT_TRUE(sl::cpuMonitorIsEnabled());
}

TEST(ProcessServicesTest, TaskQueueRunsInOrderOnItsOwnNamedThreadAndDrains) {
  std::vector<std::pair<int, std::thread::id>> ran;
  std::string workerName;
  std::promise<void> gate;
  {
    sl::TaskQueue queue("com.vantor.stowline.test");
    // The first task holds the worker, so the others are still queued when
    // the destructor starts.
    queue.async([&, ready = gate.get_future().share()] {
      ready.wait();
      sl::currentThreadName(&workerName);
    });
    for (int i = 0; i < 50; ++i) queue.async([&, i] { ran.emplace_back(i, std::this_thread::get_id()); });
    gate.set_value();
  }
  ASSERT_EQ(ran.size(), 50u);
  EXPECT_NE(ran[0].second, std::this_thread::get_id());
  for (int i = 0; i < 50; ++i) EXPECT_EQ(ran[i], std::pair(i, ran[0].second));
  EXPECT_EQ(workerName, "com.vantor.stow");  // cut to 15 bytes
}

TEST(ProcessServicesTest, ReportForException) {
  sl::ExceptionReport runtime = sl::reportForException(std::make_exception_ptr(std::runtime_error("disk on fire")));
  EXPECT_EQ(runtime.name, "std::runtime_error");
  EXPECT_TRUE(runtime.hasReason);
  EXPECT_EQ(runtime.reason, "disk on fire");
  EXPECT_FALSE(runtime.callStackSymbols.empty());

  sl::ExceptionReport number = sl::reportForException(std::make_exception_ptr(42));
  EXPECT_EQ(number.name, "int");
  EXPECT_FALSE(number.hasReason);
}

}  // namespace
