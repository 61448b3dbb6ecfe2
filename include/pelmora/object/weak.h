#pragma once
// Weak links let code refer to an object without keeping it alive. A WeakLinkable
// object owns one WeakLink from construction; the link outlives the object while any
// WeakRef holds it and is detached exactly when the object's strong count drops to 0.
// Promote and the last DecRef are serialised by the link, so a promotion racing the
// object's death either wins a counted reference or finds the object gone. Thread-safe.

#include <memory>
#include <type_traits>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora {

class PELMORA_EXPORT WeakLink : public virtual Object {
public:
   // Fills `out` with a counted reference and returns true while the object lives;
   // otherwise leaves `out` empty and returns false.
   virtual bool Promote(Ref<Object>& out) = 0;
   virtual bool IsDetached() const = 0;
};

class PELMORA_EXPORT WeakLinkable : public virtual Object {
public:
   virtual void AttachWeakRef(Ref<WeakLink>& out) = 0;
   // True if `link` is this object's link; with no link, true only for null.
   virtual bool HasLink(const WeakLink* link) const = 0;
};

class WeakLinkImpl;

// The link holder of a WeakLinkable object; one per object, created with it.
class PELMORA_EXPORT WeakLinkableImplPrivate {
public:
   WeakLinkableImplPrivate() = default;
   WeakLinkableImplPrivate(const WeakLinkableImplPrivate&) = delete;
   WeakLinkableImplPrivate& operator=(const WeakLinkableImplPrivate&) = delete;
   ~WeakLinkableImplPrivate();

   void Init(ObjectImpl* object);
   void GetLink(Ref<WeakLink>& out) const;
   bool HasLink(const WeakLink* link) const;
   // Drops one count; on the last one detaches the link and returns true.
   // `before`, when given, receives the count held before the decrement.
   bool WeakDecRef(Atomic<int32_t>& refCount, int32_t* before = nullptr) const;

private:
   WeakLinkImpl* _link = nullptr;  // one counted reference
};

template <class Base = ObjectImpl>
class WeakLinkableImpl : public virtual WeakLinkable, public Base {
public:
   template <class... Args>
   explicit WeakLinkableImpl(Args&&... args) : Base(std::forward<Args>(args)...) {
      _weak.Init(this);
   }
   // A copy is a new object with a link of its own.
   WeakLinkableImpl(const WeakLinkableImpl& other) : WeakLinkable(), Base(other) {
      _weak.Init(this);
   }

   void AttachWeakRef(Ref<WeakLink>& out) override { _weak.GetLink(out); }
   bool HasLink(const WeakLink* link) const override { return _weak.HasLink(link); }

   int DecRef() const override {
      int32_t before = 0;
      if (!_weak.WeakDecRef(this->_refCount, &before)) return before;
      const_cast<WeakLinkableImpl*>(this)->FinalDecRef(typeid(*this));
      delete this;
      return before;
   }

private:
   WeakLinkableImplPrivate _weak;
};

// A non-owning reference to a WeakLinkable object of type T.
template <class T>
class WeakRef {
public:
   WeakRef() = default;
   WeakRef(T* object) { Assign(object); }
   WeakRef(const Ref<T>& object) { Assign(object.Get()); }

   WeakRef& operator=(T* object) {
      Assign(object);
      return *this;
   }
   WeakRef& operator=(const Ref<T>& object) { return *this = object.Get(); }

   // A counted reference to the object, or null once it is gone.
   Ref<T> Promote() const {
      Ref<Object> object;
      if (!_link || !_link->Promote(object)) return Ref<T>();
      object.Release();  // its count passes to the result
      return Ref<T>::Adopt(_object);
   }
   bool IsDetached() const { return !_link || _link->IsDetached(); }
   void Reset() {
      _link.Reset();
      _object = nullptr;
   }
   const Ref<WeakLink>& GetLink() const { return _link; }

private:
   void Assign(T* object) {
      Reset();
      if (!object) return;
      // Handing out the link does not change the object.
      dynamic_cast<WeakLinkable&>(const_cast<std::remove_const_t<T>&>(*object)).AttachWeakRef(_link);
      _object = object;
   }

   Ref<WeakLink> _link;
   T* _object = nullptr;  // valid only while a promotion holds a count
};

}  // namespace Pelmora
