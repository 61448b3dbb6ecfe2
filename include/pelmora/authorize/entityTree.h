#pragma once
// An entity tree that the embedding program fills: ids with their parents under one
// root. It is the AppModelProvider the manager walks; a program that moves entities
// here tells the manager through NotifyEntityMove. Thread-safe.

#include <string>
#include <vector>

#include "pelmora/authorize/providers.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Authorize {

class PELMORA_EXPORT EntityTree : public virtual AppModelProvider {
public:
   // AuthAlreadyExistsException for a known id, AuthEntityNotFoundException for an
   // unknown parent.
   virtual void AddEntity(const std::string& id, const std::string& parentId) = 0;
   // Moves the entity with its subtree. AuthEntityNotFoundException for an unknown id or
   // parent; InvalidArgumentException for the root or a move below itself.
   virtual void MoveEntity(const std::string& id, const std::string& newParentId) = 0;
   // Removes the entity with its subtree and returns the ids removed (the root cannot
   // go: InvalidArgumentException).
   virtual void RemoveEntity(const std::string& id, std::vector<std::string>& removed) = 0;
   virtual size_t GetEntityCount() = 0;
};

PELMORA_EXPORT void CreateEntityTree(const std::string& rootId, Ref<EntityTree>& out);

}  // namespace Pelmora::Authorize
