#include "tests/support/watchdog.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include <gtest/gtest.h>

namespace Pelmora::Testing {

std::chrono::milliseconds Watchdog::DefaultLimit() {
   const char* text = std::getenv("PELMORA_TEST_WAIT_MS");
   long ms = text ? std::strtol(text, nullptr, 10) : 0;
   return std::chrono::milliseconds(ms > 0 ? ms : 60000);
}

Watchdog::Watchdog(std::string what) : Watchdog(std::move(what), DefaultLimit()) {}

Watchdog::Watchdog(std::string what, std::chrono::milliseconds limit) {
   const testing::TestInfo* test = testing::UnitTest::GetInstance()->current_test_info();
   std::string name = test ? std::string(test->test_suite_name()) + "." + test->name() : "?";
   _thread = std::thread([this, what = std::move(what), name = std::move(name), limit] {
      std::unique_lock<std::mutex> lock(_mutex);
      if (_done.wait_for(lock, limit, [this] { return _disarmed; })) return;
      std::fprintf(stderr, "[  FAILED  ] %s: still waiting for %s after %lld ms\n", name.c_str(),
                   what.c_str(), static_cast<long long>(limit.count()));
      std::fflush(stderr);
      _exit(3);
   });
}

Watchdog::~Watchdog() {
   {
      std::lock_guard<std::mutex> lock(_mutex);
      _disarmed = true;
   }
   _done.notify_one();
   _thread.join();
}

void JoinAll(std::vector<std::thread>& threads, const std::string& what) {
   Watchdog watchdog(what);
   for (std::thread& thread : threads) thread.join();
}

void Join(std::thread& thread, const std::string& what) {
   Watchdog watchdog(what);
   thread.join();
}

}  // namespace Pelmora::Testing
