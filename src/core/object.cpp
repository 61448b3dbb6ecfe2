// Reference counting, the first/last-reference hooks and the object's text form.

#include <sstream>
#include <utility>

#include "pelmora/exception/panic.h"
#include "pelmora/object/ref.h"
#include "pelmora/object/scoreboard.h"
#include "src/core/scoreboardHash2D.h"

namespace Pelmora {

std::atomic<unsigned char> AtomicUseFence{0};

const char* TypeName(const std::type_info& type) {
   const char* name = type.name();
   if (name && *name == '*') ++name;
   return name;
}

void ObjectImpl::IncRef() const {
   if (_refCount.ReadInc() != 0) return;
   try {
      // Counting is const so that a Ref<const T> works; the hooks see the object whole.
      const_cast<ObjectImpl*>(this)->FirstIncRef(typeid(*this));
   } catch (...) {
      // The object never became live: undo the count and destroy it.
      if (_refCount.ReadDec() != 1) {
         PanicVerify("1 == _obj->_refCount.ReadDec()", __FILE__, __LINE__);
      }
      delete this;
      throw;
   }
}

int ObjectImpl::DecRef() const {
   int before = _refCount.ReadDec();
   if (before != 1) return before;
   const_cast<ObjectImpl*>(this)->FinalDecRef(typeid(*this));
   delete this;
   return before;
}

ObjectImpl::~ObjectImpl() {
   if (_refCount.Read() != 0) PanicVerify("0 == _refCount", __FILE__, __LINE__);
}

std::string ObjectImpl::ToString() { return std::as_const(*this).ToString(); }

std::string ObjectImpl::ToString() const {
   try {
      std::ostringstream text;
      text << "[";
      const char* name = TypeName(typeid(*this));
      if (name) {
         text << name;
      } else {
         text.setstate(std::ios::failbit);
      }
      text << ":" << static_cast<const void*>(this) << "]";
      if (!text) return "<Unknown Type>";
      return text.str();
   } catch (...) {
      return "<Unknown Type>";
   }
}

void ObjectImpl::FirstIncRef(const std::type_info& type) {
   Scoreboard* scoreboard = Internal::GetOrCreateScoreboard();
   scoreboard->Increment(TypeName(type));
   if (RefTracker* tracker = GetRefTracker()) {
      tracker->OnFirstIncRef(this, type);
      asm volatile("" ::: "memory");  // no tail call: the tracker skips this frame by count
   }
}

void ObjectImpl::FinalDecRef(const std::type_info& type) {
   if (Scoreboard* scoreboard = GetScoreboard()) scoreboard->Decrement(TypeName(type));
   if (RefTracker* tracker = GetRefTracker()) tracker->OnFinalDecRef(this, type);
}

void ObjectImpl::GetScores(std::string& out) {
   if (Scoreboard* scoreboard = GetScoreboard()) scoreboard->Serialize(out);
   if (RefTracker* tracker = GetRefTracker()) tracker->GetScores(out);
}

}  // namespace Pelmora
