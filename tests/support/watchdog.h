#pragma once
// Deadlines for tests that wait on other threads: a lost wake-up or a deadlock becomes a
// failure that names what the test was waiting for, not an anonymous ctest time-out.
// A Watchdog not destroyed within its limit prints the test and the wait, then ends the
// binary with a failure status (a hung thread cannot be recovered in-process).
// The limit is 60 s unless PELMORA_TEST_WAIT_MS says otherwise.

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace Pelmora::Testing {

class Watchdog {
public:
   explicit Watchdog(std::string what);
   Watchdog(std::string what, std::chrono::milliseconds limit);
   ~Watchdog();
   Watchdog(const Watchdog&) = delete;
   Watchdog& operator=(const Watchdog&) = delete;

   static std::chrono::milliseconds DefaultLimit();

private:
   std::mutex _mutex;
   std::condition_variable _done;
   bool _disarmed = false;
   std::thread _thread;
};

// Joins `threads` under one Watchdog named `what`.
void JoinAll(std::vector<std::thread>& threads, const std::string& what);
void Join(std::thread& thread, const std::string& what);

}  // namespace Pelmora::Testing
