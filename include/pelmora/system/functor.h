#pragma once
// A Functor is the bound callable of every callback and work item: a copyable value that
// holds any callable taking up to kFunctorMaxArguments arguments. An empty Functor
// converts to false and must not be called. Copies share nothing mutable; a single
// Functor is not thread-safe (like any value, share it by copying).

#include <functional>
#include <type_traits>
#include <utility>

namespace Pelmora::System {

constexpr int kFunctorMaxArguments = 6;

template <class R = void, class... Args>
class Functor {
   static_assert(sizeof...(Args) <= kFunctorMaxArguments, "too many Functor arguments");

public:
   Functor() = default;
   template <class F,
             class = std::enable_if_t<!std::is_same_v<std::decay_t<F>, Functor> &&
                                      std::is_invocable_r_v<R, F&, Args...>>>
   Functor(F&& callable) : _callable(std::forward<F>(callable)) {}

   R operator()(Args... args) const { return _callable(std::forward<Args>(args)...); }
   explicit operator bool() const noexcept { return static_cast<bool>(_callable); }
   void Reset() noexcept { _callable = nullptr; }

private:
   std::function<R(Args...)> _callable;
};

}  // namespace Pelmora::System
