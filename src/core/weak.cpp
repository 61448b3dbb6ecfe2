// Weak links: detaching on the last DecRef and promotion, serialised by the link's mutex.

#include "pelmora/object/weak.h"

#include "pelmora/exception/panic.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora {

class WeakLinkImpl : public virtual WeakLink, public ObjectImpl {
public:
   explicit WeakLinkImpl(ObjectImpl* object) : _object(object) {}

   bool Promote(Ref<Object>& out) override {
      ObjectImpl* kept = nullptr;
      {
         System::NativeSynchronized lock(_mutex);
         // Raise the count directly, not through IncRef: no first-reference hook may run,
         // and a count already at 0 means the object is dying.
         if (_object && _object->_refCount.ReadInc() != 0) {
            kept = _object;
         } else if (_object) {
            _object->_refCount.ReadDec();
         }
      }
      if (!kept) {
         out.Reset();
         return false;
      }
      // The temporary count becomes the one `out` holds: the same as assigning and then
      // dropping the temporary, two atomic steps fewer.
      out = Ref<Object>::Adopt(static_cast<Object*>(kept));
      return true;
   }

   bool IsDetached() const override {
      System::NativeSynchronized lock(_mutex);
      return _object == nullptr;
   }

   // Called with the object's count just gone from 1 to 0.
   void Detach() {
      System::NativeSynchronized lock(_mutex);
      if (_object == nullptr) PanicVerify("_object != __null", __FILE__, __LINE__);
      _object = nullptr;
   }

private:
   mutable System::NativeMutex _mutex;
   ObjectImpl* _object PELMORA_GUARDED_BY(_mutex);
};

WeakLinkableImplPrivate::~WeakLinkableImplPrivate() {
   PELMORA_VERIFY(NULL != _link);
   WeakLinkImpl* link = _link;
   _link = nullptr;
   link->DecRef();
}

void WeakLinkableImplPrivate::Init(ObjectImpl* object) {
   PELMORA_VERIFY(NULL == _link);
   WeakLinkImpl* link = new WeakLinkImpl(object);
   link->IncRef();
   _link = link;
}

void WeakLinkableImplPrivate::GetLink(Ref<WeakLink>& out) const { out = _link; }

bool WeakLinkableImplPrivate::HasLink(const WeakLink* link) const {
   if (!_link) return link == nullptr;
   return link == static_cast<const WeakLink*>(_link);
}

bool WeakLinkableImplPrivate::WeakDecRef(Atomic<int32_t>& refCount, int32_t* before) const {
   int32_t old = refCount.ReadDec();
   if (before) *before = old;
   if (old != 1) return false;
   _link->Detach();
   return true;
}

}  // namespace Pelmora
