#pragma once
// Object is the root interface of every shared object; ObjectImpl holds the intrusive
// count and its hooks; Ref<T> is the smart pointer that takes and drops references.
// An object is destroyed by the DecRef that takes its count from 1 to 0. Counting is
// lock-free and thread-safe; a single Ref is not (like any value, share it by copying).

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <typeinfo>
#include <type_traits>
#include <utility>

#include "pelmora/object/export.h"
#include "pelmora/object/atomic.h"

namespace Pelmora {

class PELMORA_EXPORT Object {
public:
   virtual void IncRef() const = 0;
   // Returns the count held before the decrement.
   virtual int DecRef() const = 0;
   // "[" mangled-type-name ":" address "]", or "<Unknown Type>".
   virtual std::string ToString() = 0;
   virtual int GetRefCount() const = 0;
   virtual ~Object() = default;
};

class PELMORA_EXPORT ObjectImpl : public virtual Object {
public:
   ObjectImpl() = default;
   // Copying an object never copies its count: the copy starts unreferenced.
   ObjectImpl(const ObjectImpl&) : Object() {}
   ObjectImpl& operator=(const ObjectImpl&) { return *this; }

   void IncRef() const override;
   int DecRef() const override;
   // Calls the const form, so that a class may override either one.
   std::string ToString() override;
   // The default text, for classes that describe themselves from a const object.
   virtual std::string ToString() const;
   int GetRefCount() const override { return _refCount.Read(); }
   // Panics unless the count is zero: an object dies only through its last DecRef.
   ~ObjectImpl() override;

   // Appends the scoreboard's text, then the reference tracker's, where they exist.
   static void GetScores(std::string& out);

protected:
   // Run on the 0 -> 1 and 1 -> 0 transitions with the dynamic type.
   virtual void FirstIncRef(const std::type_info& type);
   virtual void FinalDecRef(const std::type_info& type);

   mutable Atomic<int32_t> _refCount{0};

   friend class WeakLinkImpl;
   friend class WeakLinkableImplPrivate;
};

// The name the scoreboard and ToString use for a type: its mangled name, one leading '*' skipped.
PELMORA_EXPORT const char* TypeName(const std::type_info& type);

[[noreturn]] PELMORA_EXPORT void ThrowTypeMismatchException(const std::type_info& wanted,
                                             const std::type_info& actual);

template <class T>
class Ref {
public:
   using element_type = T;

   Ref() noexcept = default;
   Ref(std::nullptr_t) noexcept {}
   Ref(T* object) : _ptr(object) {
      if (_ptr) _ptr->IncRef();
   }
   Ref(const Ref& other) : Ref(other._ptr) {}
   Ref(Ref&& other) noexcept : _ptr(std::exchange(other._ptr, nullptr)) {}
   template <class U, class = std::enable_if_t<std::is_convertible_v<U*, T*>>>
   Ref(const Ref<U>& other) : Ref(static_cast<T*>(other.Get())) {}
   template <class U, class = std::enable_if_t<std::is_convertible_v<U*, T*>>>
   Ref(Ref<U>&& other) noexcept : _ptr(other.Release()) {}

   ~Ref() {
      if (_ptr) _ptr->DecRef();
   }

   // The new target is referenced first, then stored, then the old one released,
   // so assigning a Ref to itself (or to a Ref it keeps alive) is safe.
   Ref& operator=(T* object) {
      if (object) object->IncRef();
      T* old = std::exchange(_ptr, object);
      if (old) old->DecRef();
      return *this;
   }
   Ref& operator=(const Ref& other) { return *this = other._ptr; }
   Ref& operator=(Ref&& other) noexcept {
      T* old = std::exchange(_ptr, std::exchange(other._ptr, nullptr));
      if (old) old->DecRef();
      return *this;
   }
   template <class U, class = std::enable_if_t<std::is_convertible_v<U*, T*>>>
   Ref& operator=(const Ref<U>& other) {
      return *this = static_cast<T*>(other.Get());
   }

   // Takes over a count the caller already owns, without a new IncRef.
   static Ref Adopt(T* object) noexcept {
      Ref r;
      r._ptr = object;
      return r;
   }

   void Reset() { *this = static_cast<T*>(nullptr); }
   // Gives up the reference without dropping it; the caller now owns one count.
   T* Release() noexcept { return std::exchange(_ptr, nullptr); }

   T* Get() const noexcept { return _ptr; }
   T* operator->() const noexcept { return _ptr; }
   T& operator*() const noexcept { return *_ptr; }
   explicit operator bool() const noexcept { return _ptr != nullptr; }
   bool IsNull() const noexcept { return _ptr == nullptr; }

   // Checked downcast (or cross-cast): a null source gives a null result; an object of
   // another type throws TypeMismatchException.
   template <class U>
   Ref<U> Cast() const {
      if (!_ptr) return Ref<U>();
      U* target = dynamic_cast<U*>(_ptr);
      if (!target) ThrowTypeMismatchException(typeid(U), typeid(*_ptr));
      return Ref<U>(target);
   }

private:
   T* _ptr = nullptr;
};

// Checked downcast of a raw pointer into a Ref, with the rules of Ref::Cast.
template <class U, class T>
Ref<U> RefCast(T* object) {
   return Ref<T>(object).template Cast<U>();
}

template <class T, class U>
bool operator==(const Ref<T>& a, const Ref<U>& b) noexcept {
   return a.Get() == b.Get();
}
template <class T>
bool operator==(const Ref<T>& a, std::nullptr_t) noexcept {
   return a.Get() == nullptr;
}
template <class T, class U>
auto operator<=>(const Ref<T>& a, const Ref<U>& b) noexcept {
   return std::compare_three_way()(a.Get(), b.Get());
}

}  // namespace Pelmora

template <class T>
struct std::hash<Pelmora::Ref<T>> {
   size_t operator()(const Pelmora::Ref<T>& r) const noexcept { return std::hash<T*>()(r.Get()); }
};
