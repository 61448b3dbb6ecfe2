#pragma once
// Privileges and privilege sets. A Privilege is an id "Group.Name" with a dense index;
// a PrivSet is a fixed set of 1024 bits indexed by privilege index, so that testing a
// privilege is one bit test. Privileges are immutable once made; a PrivSet is a value.

#include <bitset>
#include <string>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Authorize {

constexpr unsigned MAX_PRIVILEGES = 1024;

// The built-in privileges, present before any are loaded, and their indexes.
constexpr const char* kPrivilegeGroupSystem = "System";
constexpr const char* kPrivilegeAnonymous = "System.Anonymous";
constexpr const char* kPrivilegeView = "System.View";
constexpr const char* kPrivilegeRead = "System.Read";
constexpr unsigned kPrivilegeIndexAnonymous = 0;
constexpr unsigned kPrivilegeIndexView = 1;
constexpr unsigned kPrivilegeIndexRead = 2;

class PELMORA_EXPORT PrivSet {
public:
   // An index of MAX_PRIVILEGES or more panics.
   void Set(unsigned index) {
      PELMORA_VERIFY(index < MAX_PRIVILEGES);
      _bits.set(index);
   }
   void Clear(unsigned index) {
      PELMORA_VERIFY(index < MAX_PRIVILEGES);
      _bits.reset(index);
   }
   bool Test(unsigned index) const {
      PELMORA_VERIFY(index < MAX_PRIVILEGES);
      return _bits.test(index);
   }
   void SetAll() { _bits.set(); }
   void ClearAll() { _bits.reset(); }
   size_t Count() const { return _bits.count(); }
   bool IsEmpty() const { return _bits.none(); }
   PrivSet& operator|=(const PrivSet& other) {
      _bits |= other._bits;
      return *this;
   }
   friend bool operator==(const PrivSet& a, const PrivSet& b) { return a._bits == b._bits; }

private:
   std::bitset<MAX_PRIVILEGES> _bits;
};

// A privilege as callers define it: its id and the group it belongs to.
struct PELMORA_EXPORT PrivilegeDef {
   std::string id;
   std::string groupId;
};

class PELMORA_EXPORT Privilege : public ObjectImpl {
public:
   // The id begins with the group id and a dot and names something after it; anything
   // else panics.
   Privilege(const std::string& id, const std::string& groupId, unsigned index);

   const std::string& GetId() const { return _id; }
   const std::string& GetGroupId() const { return _groupId; }
   // The part after "<group>.".
   std::string GetName() const { return _id.substr(_groupId.length() + 1); }
   unsigned GetIndex() const { return _index; }
   bool IsSystem() const { return _index <= kPrivilegeIndexRead; }

private:
   const std::string _id;
   const std::string _groupId;
   const unsigned _index;
};

using PrivilegeResult = std::vector<Ref<Privilege>>;

}  // namespace Pelmora::Authorize
