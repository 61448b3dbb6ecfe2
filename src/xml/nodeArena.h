#pragma once
// Memory for the nodes of one parsed document: bump allocation from large blocks, all
// freed together when the last node taken from it is destroyed. A parser builds and a
// document's release destroys nodes by the million, where the general heap is the cost.
// The price: one node kept alive keeps its whole document's node memory.
// Allocate belongs to the building thread; Release may run on any thread.

#include <atomic>
#include <cstddef>
#include <string_view>
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
   // A name for this arena's elements, made from `qualifiedName`, which is copied into
   // the arena too and `stored` set to the copy. Both live as long as the arena. By the
   // creator, before ReleaseCreator.
   const ElementName* NewName(std::string_view qualifiedName, std::string_view& stored);

private:
   // The creator's reference counts as this many, so that nodes need no atomic increment
   // when they are made: nodes freed while the creator still holds it can never bring the
   // count to zero, and ReleaseCreator trades the bias for the nodes made meanwhile.
   static constexpr size_t kCreatorBias = size_t{1} << 62;

   ~NodeArena();
   void Drop(size_t references);
   // As Allocate, for memory that holds no node reference.
   void* AllocateRaw(size_t size);

   std::atomic<size_t> _references{kCreatorBias};
   size_t _allocated = 0;  // by the creator's thread only
   std::vector<char*> _blocks;
   char* _cursor = nullptr;
   char* _end = nullptr;
   // The names made here, newest first, to be destroyed with the arena.
   struct StoredName;
   StoredName* _names = nullptr;
};

}  // namespace Pelmora::Xml
