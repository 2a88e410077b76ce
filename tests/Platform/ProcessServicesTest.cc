#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <future>
#include <stdexcept>
#include <thread>
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
  std::vector<int> order;
  std::vector<std::thread::id> threads;
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
    for (int i = 0; i < 50; ++i) {
      queue.async([&, i] {
        order.push_back(i);
        threads.push_back(std::this_thread::get_id());
      });
    }
    gate.set_value();
  }
  ASSERT_EQ(order.size(), 50u);
  for (int i = 0; i < 50; ++i) EXPECT_EQ(order[i], i);
  for (const auto& id : threads) EXPECT_EQ(id, threads.front());
  EXPECT_NE(threads.front(), std::this_thread::get_id());
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
