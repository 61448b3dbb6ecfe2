#include "pelmora/authorize/entityTree.h"

#include <mutex>
#include <shared_mutex>
#include <unordered_map>

#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/exceptions.h"

namespace Pelmora::Authorize {

namespace {

class TreeEntity : public virtual AuthEntity, public ObjectImpl {
public:
   explicit TreeEntity(const std::string& id) : _id(id) {}
   const std::string& GetId() const override { return _id; }

private:
   const std::string _id;
};

class EntityTreeImpl : public virtual EntityTree, public ObjectImpl {
public:
   explicit EntityTreeImpl(const std::string& rootId) : _rootId(rootId) {
      _nodes.emplace(rootId, Node{new TreeEntity(rootId), std::string(), {}});
   }

   bool FindEntity(const std::string& id, Ref<AuthEntity>& out) override {
      std::shared_lock lock(_mutex);
      auto it = _nodes.find(id);
      if (it == _nodes.end()) return false;
      out = it->second.entity;
      return true;
   }

   void GetRootEntity(Ref<AuthEntity>& out) override {
      std::shared_lock lock(_mutex);
      out = _nodes.at(_rootId).entity;
   }

   void GetParentChain(const std::string& id, ParentChain& out) override {
      out.clear();
      std::shared_lock lock(_mutex);
      const Node* node = Find(id);
      while (!node->parent.empty()) {
         out.push_back(node->parent);
         node = Find(node->parent);
      }
   }

   void AddEntity(const std::string& id, const std::string& parentId) override {
      std::unique_lock lock(_mutex);
      if (_nodes.count(id)) throw AuthAlreadyExistsException();
      Find(parentId)->children.push_back(id);
      _nodes.emplace(id, Node{new TreeEntity(id), parentId, {}});
   }

   void MoveEntity(const std::string& id, const std::string& newParentId) override {
      std::unique_lock lock(_mutex);
      Node* node = Find(id);
      Find(newParentId);
      if (id == _rootId) throw InvalidArgumentException("the root cannot move");
      for (std::string up = newParentId; !up.empty(); up = Find(up)->parent) {
         if (up == id) throw InvalidArgumentException("cannot move " + id + " below itself");
      }
      std::erase(Find(node->parent)->children, id);
      node->parent = newParentId;
      Find(newParentId)->children.push_back(id);
   }

   void RemoveEntity(const std::string& id, std::vector<std::string>& removed) override {
      removed.clear();
      std::unique_lock lock(_mutex);
      Node* node = Find(id);
      if (id == _rootId) throw InvalidArgumentException("the root cannot be removed");
      std::erase(Find(node->parent)->children, id);
      std::vector<std::string> pending{id};
      while (!pending.empty()) {
         std::string next = std::move(pending.back());
         pending.pop_back();
         auto it = _nodes.find(next);
         for (const std::string& child : it->second.children) pending.push_back(child);
         _nodes.erase(it);
         removed.push_back(std::move(next));
      }
   }

   size_t GetEntityCount() override {
      std::shared_lock lock(_mutex);
      return _nodes.size();
   }

private:
   struct Node {
      Ref<AuthEntity> entity;
      std::string parent;
      std::vector<std::string> children;
   };

   Node* Find(const std::string& id) {
      auto it = _nodes.find(id);
      if (it == _nodes.end()) throw AuthEntityNotFoundException(id);
      return &it->second;
   }

   const std::string _rootId;
   std::shared_mutex _mutex;
   std::unordered_map<std::string, Node> _nodes;
};

}  // namespace

void CreateEntityTree(const std::string& rootId, Ref<EntityTree>& out) { out = new EntityTreeImpl(rootId); }

}  // namespace Pelmora::Authorize
