#pragma once
// Memory for the nodes of one parsed document: bump allocation from large blocks, all
// freed together when the last node taken from it is destroyed. A parser builds and a
// document's release destroys nodes by the million, where the general heap is the cost.
// The price: one node kept alive keeps its whole document's node memory.
// Allocate belongs to the building thread; Release may run on any thread.

#include <atomic>
#include <cstddef>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace Pelmora::Xml {

struct ElementName;

class NodeArena {
public:
   // The creator holds the first reference and gives it up with ReleaseCreator.
   NodeArena() = default;
   NodeArena(const NodeArena&) = delete;
   NodeArena& operator=(const NodeArena&) = delete;

   // Memory for one node, 16-byte aligned; the node holds a reference until it dies.
   void* Allocate(size_t size);
   // Drops a node's reference; the last frees every block.
   void Release();
   // Drops the creator's reference, after its last Allocate.
   void ReleaseCreator();
   // The one name of this arena's elements called `qualifiedName`; it lives as long as
   // the arena. By the creator, before ReleaseCreator. A document names few kinds of
   // element many times: shared, the names cost a lookup instead of two strings a node.
   const ElementName* InternName(std::string_view qualifiedName);

private:
   // The creator's reference counts as this many, so that nodes need no atomic increment
   // when they are made: nodes freed while the creator still holds it can never bring the
   // count to zero, and ReleaseCreator trades the bias for the nodes made meanwhile.
   static constexpr size_t kCreatorBias = size_t{1} << 62;

   ~NodeArena();
   void Drop(size_t references);

   std::atomic<size_t> _references{kCreatorBias};
   size_t _allocated = 0;  // by the creator's thread only
   std::vector<char*> _blocks;
   char* _cursor = nullptr;
   char* _end = nullptr;
   // The interned names by qualified name; the keys view the stored qualified names.
   struct Interned;
   std::unordered_map<std::string_view, Interned*> _names;
   std::vector<Interned*> _interned;
};

}  // namespace Pelmora::Xml
