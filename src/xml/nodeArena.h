#pragma once
// Memory for the nodes of one parsed document: bump allocation from large blocks, all
// freed together when the last node taken from it is destroyed. A parser builds and a
// document's release destroys nodes by the million, where the general heap is the cost.
// The price: one node kept alive keeps its whole document's node memory.
// Allocate belongs to the building thread; Release may run on any thread.

#include <atomic>
#include <cstddef>
#include <vector>

namespace Pelmora::Xml {

class NodeArena {
public:
   // The creator holds the first reference and gives it up with Release.
   NodeArena() = default;
   NodeArena(const NodeArena&) = delete;
   NodeArena& operator=(const NodeArena&) = delete;

   // Memory for one node, 16-byte aligned; the node holds a reference until it dies.
   void* Allocate(size_t size);
   // Drops one reference; the last frees every block.
   void Release();

private:
   ~NodeArena();

   std::atomic<size_t> _references{1};
   std::vector<char*> _blocks;
   char* _cursor = nullptr;
   char* _end = nullptr;
};

}  // namespace Pelmora::Xml
