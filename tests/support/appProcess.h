#pragma once
// Helpers for tests of the application object, which exists once per process: scenarios
// run in a child (a death test that re-executes the binary) and report through the exit
// status, and files in a scratch directory carry configurations and logs.

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>

#include <gtest/gtest.h>

// In a child scenario: a failed check ends the child with status 100 and names itself
// on standard error, which the parent's EXPECT_EXIT shows.
#define APP_CHILD_CHECK(cond)                                                     \
   do {                                                                           \
      if (!(cond)) {                                                              \
         fprintf(stderr, "child check failed: %s (line %d)\n", #cond, __LINE__); \
         fflush(stderr);                                                          \
         _exit(100);                                                              \
      }                                                                           \
   } while (0)

namespace Pelmora::Testing {

// A directory named after the test and the test process: a death test's child (which
// runs the test body again up to its statement) finds the parent's directory, and only
// the parent removes it.
class ScratchDir {
public:
   ScratchDir() : _child(!GTEST_FLAG_GET(internal_run_death_test).empty()) {
      const testing::TestInfo* test = testing::UnitTest::GetInstance()->current_test_info();
      _path = "/tmp/pelmora-app-" + std::to_string(_child ? getppid() : getpid()) + "-" +
              (test ? test->name() : "none");
      if (!_child) Remove(_path);
      mkdir(_path.c_str(), 0755);
   }
   ~ScratchDir() {
      if (!_child) Remove(_path);
   }
   const std::string& Path() const { return _path; }
   std::string operator/(const std::string& name) const { return _path + "/" + name; }

private:
   static void Remove(const std::string& path) {
      if (DIR* dir = opendir(path.c_str())) {
         while (dirent* entry = readdir(dir)) {
            std::string name = entry->d_name;
            if (name == "." || name == "..") continue;
            std::string child = path + "/" + name;
            struct stat info;
            if (lstat(child.c_str(), &info) == 0 && S_ISDIR(info.st_mode)) {
               Remove(child);
            } else {
               unlink(child.c_str());
            }
         }
         closedir(dir);
      }
      rmdir(path.c_str());
   }
   bool _child;
   std::string _path;
};

inline void WriteText(const std::string& path, const std::string& text) {
   std::ofstream(path, std::ios::binary) << text;
}

inline std::string ReadText(const std::string& path) {
   std::ifstream in(path, std::ios::binary);
   std::stringstream text;
   text << in.rdbuf();
   return text.str();
}

inline bool Contains(const std::string& text, const std::string& piece) {
   return text.find(piece) != std::string::npos;
}

inline size_t CountOf(const std::string& text, const std::string& piece) {
   size_t count = 0;
   for (size_t at = text.find(piece); at != std::string::npos; at = text.find(piece, at + 1)) ++count;
   return count;
}

// Polls `condition` every millisecond until it holds or `limit` passes.
inline bool WaitUntil(const std::function<bool()>& condition,
                      std::chrono::milliseconds limit = std::chrono::milliseconds(5000)) {
   auto deadline = std::chrono::steady_clock::now() + limit;
   while (!condition()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
   }
   return true;
}

}  // namespace Pelmora::Testing
