#pragma once
// Memory for the nodes of one parsed document, their names and their parsed attribute
// lists: bump allocation from large blocks, all given back together when the last node
// taken from it is destroyed (the first block is kept, one for the whole process, for the
// next document). A parser builds and a document's release destroys nodes by the million,
// where the general heap is the cost. The price: one node kept alive keeps its whole
// document's node memory.
// Allocate belongs to the building thread; Release may run on any thread.

#include <atomic>
#include <cstddef>
#include <cstdint>
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

   // Memory for one node, pointer-aligned; the node holds a reference until it dies.
   void* Allocate(size_t size) {
      ++_allocated;
      return AllocateRaw(size);
   }
   // As Allocate, for memory that holds no node reference. Inline: a parse calls it per
   // node, and a new block is rare. A request ahead of the end of a block is harmless.
   void* AllocateRaw(size_t size) {
      size = (size + alignof(void*) - 1) & ~(alignof(void*) - 1);
      if (static_cast<size_t>(_end - _cursor) < size) StartBlock(size);
      void* memory = _cursor;
      _cursor += size;
      // Node memory is written once, in order: ask for what follows early.
      __builtin_prefetch(reinterpret_cast<const void*>(reinterpret_cast<uintptr_t>(_cursor) +
                                                       kWriteAhead),
                         1);
      return memory;
   }
   // Drops a node's reference; the last frees every block.
   void Release();
   // Drops the references of `count` nodes at once.
   void Release(size_t count);
   // Drops the creator's reference, after its last Allocate.
   void ReleaseCreator();
   // Whether the creator still builds: only then may its nodes' parts come from here.
   bool IsBuilding() const { return _building; }
   // A name for this arena's elements, made from `qualifiedName`, which is copied into
   // the arena too and `stored` set to the copy. Both live as long as the arena. By the
   // creator, before ReleaseCreator.
   const ElementName* NewName(std::string_view qualifiedName, std::string_view& stored);

private:
   // How far ahead of the next allocation the memory is asked for.
   static constexpr size_t kWriteAhead = 4096;
   // The creator's reference counts as this many, so that nodes need no atomic increment
   // when they are made: nodes freed while the creator still holds it can never bring the
   // count to zero, and ReleaseCreator trades the bias for the nodes made meanwhile.
   static constexpr size_t kCreatorBias = size_t{1} << 62;

   ~NodeArena();
   void Drop(size_t references);
   // Makes a new block, with room for `size` bytes, the one allocated from.
   void StartBlock(size_t size);

   std::atomic<size_t> _references{kCreatorBias};
   size_t _allocated = 0;  // by the creator's thread only
   bool _building = true;
   bool _firstBlockIsSpare = false;  // of the first size: goes to the spare slot
   struct Block {
      char* start;
      bool mapped;  // from MapBlock rather than the heap
   };
   std::vector<Block> _blocks;
   size_t _taken = 0;  // bytes in all blocks
   char* _cursor = nullptr;
   char* _end = nullptr;
   // The names made here, newest first, to be destroyed with the arena.
   struct StoredName;
   StoredName* _names = nullptr;
};

// Memory for a part of a node (an element's attribute list): from `arena` while its creator
// builds, from the heap otherwise. Parts from an arena go with the arena; FreeNodePart
// frees either kind.
void* AllocateNodePart(NodeArena* arena, size_t size);
void FreeNodePart(void* part);

// Frees the memory of nodes whose destructors have run, from whichever heap or arena each
// came, releasing each arena once per run of its nodes rather than once per node.
class NodeDisposal {
public:
   NodeDisposal() = default;
   NodeDisposal(const NodeDisposal&) = delete;
   NodeDisposal& operator=(const NodeDisposal&) = delete;
   ~NodeDisposal() { Flush(); }

   // `node` is the address of the complete node object, as operator new returned it.
   void Free(void* node);
   void Flush();

private:
   NodeArena* _arena = nullptr;
   size_t _count = 0;
};

}  // namespace Pelmora::Xml
