// The core against its peers: reference counting against std::shared_ptr, message
// formatting against snprintf and fmt, and the cost of an exception.

#include <fmt/format.h>

#include <cstdio>
#include <memory>
#include <string>

#include "pelmora/pelmora.h"
#include "support/ratioMain.h"

using namespace Pelmora;

namespace {

class Payload : public WeakLinkableImpl<> {
public:
   int value = 7;
};

struct PlainPayload {
   int value = 7;
};

void BM_RefCopyDrop(benchmark::State& state) {
   Ref<Payload> object = new Payload();
   for (auto _ : state) {
      Ref<Payload> copy = object;
      benchmark::DoNotOptimize(copy.Get());
   }
}
BENCHMARK(BM_RefCopyDrop);

void BM_SharedPtrCopyDrop(benchmark::State& state) {
   auto object = std::make_shared<PlainPayload>();
   for (auto _ : state) {
      std::shared_ptr<PlainPayload> copy = object;
      benchmark::DoNotOptimize(copy.get());
   }
}
BENCHMARK(BM_SharedPtrCopyDrop);

void BM_WeakRefPromoteDrop(benchmark::State& state) {
   Ref<Payload> object = new Payload();
   WeakRef<Payload> weak = object;
   for (auto _ : state) {
      Ref<Payload> promoted = weak.Promote();
      benchmark::DoNotOptimize(promoted.Get());
   }
}
BENCHMARK(BM_WeakRefPromoteDrop);

void BM_WeakPtrLockDrop(benchmark::State& state) {
   auto object = std::make_shared<PlainPayload>();
   std::weak_ptr<PlainPayload> weak = object;
   for (auto _ : state) {
      std::shared_ptr<PlainPayload> promoted = weak.lock();
      benchmark::DoNotOptimize(promoted.get());
   }
}
BENCHMARK(BM_WeakPtrLockDrop);

const std::string kUser = "operator";

void BM_ASPrintThreeArgs(benchmark::State& state) {
   for (auto _ : state) {
      std::string text = MessageFormatter::ASPrint("request %1 from %2 took %3 ms", 48213, kUser, 12.5);
      benchmark::DoNotOptimize(text.data());
   }
}
BENCHMARK(BM_ASPrintThreeArgs);

void BM_SnprintfThreeArgs(benchmark::State& state) {
   for (auto _ : state) {
      char buffer[128];
      int n = snprintf(buffer, sizeof(buffer), "request %d from %s took %g ms", 48213, kUser.c_str(), 12.5);
      std::string text(buffer, n);
      benchmark::DoNotOptimize(text.data());
   }
}
BENCHMARK(BM_SnprintfThreeArgs);

void BM_FmtThreeArgs(benchmark::State& state) {
   for (auto _ : state) {
      std::string text = fmt::format("request {} from {} took {} ms", 48213, kUser, 12.5);
      benchmark::DoNotOptimize(text.data());
   }
}
BENCHMARK(BM_FmtThreeArgs);

[[gnu::noinline]] void ThrowInvalidArgument() { throw InvalidArgumentException("key"); }
[[gnu::noinline]] void ThrowRuntimeError() { throw std::runtime_error("Invalid argument : key"); }

void BM_ExceptionConstructCatch(benchmark::State& state) {
   for (auto _ : state) {
      try {
         ThrowInvalidArgument();
      } catch (const Exception& e) {
         benchmark::DoNotOptimize(e.what());
      }
   }
}
BENCHMARK(BM_ExceptionConstructCatch);

void BM_StdExceptionConstructCatch(benchmark::State& state) {
   for (auto _ : state) {
      try {
         ThrowRuntimeError();
      } catch (const std::exception& e) {
         benchmark::DoNotOptimize(e.what());
      }
   }
}
BENCHMARK(BM_StdExceptionConstructCatch);

}  // namespace

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(argc, argv,
                                      {{"BM_RefCopyDrop", "BM_SharedPtrCopyDrop"},
                                       {"BM_WeakRefPromoteDrop", "BM_WeakPtrLockDrop"},
                                       {"BM_ASPrintThreeArgs", "BM_SnprintfThreeArgs"},
                                       {"BM_ASPrintThreeArgs", "BM_FmtThreeArgs"},
                                       {"BM_ExceptionConstructCatch", "BM_StdExceptionConstructCatch"}});
}
