// Backtraces: raw return addresses from the unwinder at capture; symbols looked up with
// dladdr and demangled only when the text is asked for.

#include <cxxabi.h>
#include <dlfcn.h>
#include <execinfo.h>

#include <cstdio>
#include <cstdlib>
#include <memory>

#include "pelmora/exception/backtrace.h"

namespace Pelmora::System {

namespace {

class BacktraceImpl : public virtual Backtrace, public ObjectImpl {
public:
   BacktraceImpl(void* const* frames, int count) : _count(count) {
      for (int i = 0; i < count; ++i) _frames[i] = frames[i];
   }

   int GetFrameCount() const override { return _count; }
   void* GetFrame(int index) const override {
      return index >= 0 && index < _count ? _frames[index] : nullptr;
   }

   std::string GetText(int firstFrame, int maxFrames) const override {
      std::string text;
      if (firstFrame < 0) firstFrame = 0;
      int end = _count;
      if (maxFrames >= 0 && firstFrame + maxFrames < end) end = firstFrame + maxFrames;
      for (int i = firstFrame; i < end; ++i) {
         AppendFrame(i - firstFrame, _frames[i], text);
         text += '\n';
      }
      return text;
   }

private:
   static void AppendFrame(int number, void* address, std::string& text) {
      char line[128];
      snprintf(line, sizeof(line), "#%d %p ", number, address);
      text += line;
      Dl_info info{};
      // A return address points past the call; look up the byte before it.
      void* lookup = static_cast<char*>(address) - 1;
      if (!dladdr(lookup, &info)) {
         text += "??";
         return;
      }
      if (info.dli_sname) {
         int status = 0;
         std::unique_ptr<char, decltype(&free)> demangled(
            abi::__cxa_demangle(info.dli_sname, nullptr, nullptr, &status), &free);
         text += status == 0 && demangled ? demangled.get() : info.dli_sname;
         snprintf(line, sizeof(line), "+0x%zx",
                  static_cast<size_t>(static_cast<char*>(address) -
                                      static_cast<char*>(info.dli_saddr)));
         text += line;
      } else {
         text += "??";
      }
      if (info.dli_fname) {
         snprintf(line, sizeof(line), "+0x%zx)",
                  static_cast<size_t>(static_cast<char*>(address) -
                                      static_cast<char*>(info.dli_fbase)));
         text += " (";
         text += info.dli_fname;
         text += line;
      }
   }

   int _count;
   void* _frames[kMaxBacktraceFrames];
};

}  // namespace

__attribute__((noinline)) void CaptureBacktrace(int skipFrames, Ref<Backtrace>& out) {
   void* frames[kMaxBacktraceFrames + 10];
   int wanted = kMaxBacktraceFrames + 2 + (skipFrames > 0 ? skipFrames : 0);
   if (wanted > static_cast<int>(sizeof(frames) / sizeof(frames[0]))) {
      wanted = sizeof(frames) / sizeof(frames[0]);
   }
   int count = backtrace(frames, wanted);
   // Leave out this function, and the sanitizers' interceptor of backtrace() where there
   // is one: the caller's frame is the one holding this function's return address. Then
   // the frames the caller asked to skip.
   int caller = 1;
   void* const returnAddress = __builtin_return_address(0);
   for (int i = 0; i < count && i < 4; ++i) {
      if (frames[i] == returnAddress) {
         caller = i;
         break;
      }
   }
   int first = caller + (skipFrames > 0 ? skipFrames : 0);
   if (first > count) first = count;
   int kept = count - first;
   if (kept > kMaxBacktraceFrames) kept = kMaxBacktraceFrames;
   out = new BacktraceImpl(frames + first, kept);
}

namespace {
// The unwinder loads itself on first use; do that before any panic needs it.
[[maybe_unused]] const int g_warmUp = [] {
   void* frame[1];
   return backtrace(frame, 1);
}();
}  // namespace

}  // namespace Pelmora::System
