// The node arena and the allocation functions of NodeImpl that choose between it and the
// general heap.

#include "src/xml/nodeArena.h"

#include <algorithm>
#include <new>

#include "src/xml/nodeImpl.h"

namespace Pelmora::Xml {
namespace {

// Blocks double from the first size, which suits a request-sized document, up to the
// largest, which keeps block allocation rare while staying below the heap's mmap threshold.
constexpr size_t kFirstBlockSize = 8 * 1024;
constexpr size_t kLargestBlockSize = 64 * 1024;
constexpr size_t kAlignment = 16;
// Before each node: the arena it came from, or null for the general heap; one alignment
// unit, so that the node itself stays aligned.
constexpr size_t kHeaderSize = kAlignment;

size_t RoundUp(size_t size) {
   return (size + kAlignment - 1) & ~(kAlignment - 1);
}

}  // namespace

struct NodeArena::StoredName {
   ElementName name;
   StoredName* next;
};

NodeArena::~NodeArena() {
   for (StoredName* stored = _names; stored;) {
      StoredName* next = stored->next;
      stored->~StoredName();
      stored = next;
   }
   for (char* block : _blocks) ::operator delete(block);
}

const ElementName* NodeArena::NewName(std::string_view qualifiedName, std::string_view& stored) {
   char* text = static_cast<char*>(AllocateRaw(qualifiedName.size()));
   std::copy(qualifiedName.begin(), qualifiedName.end(), text);
   auto* name = new (AllocateRaw(sizeof(StoredName)))
       StoredName{ElementName::FromQualified(qualifiedName), _names};
   _names = name;
   stored = std::string_view(text, qualifiedName.size());
   return &name->name;
}

void* NodeArena::Allocate(size_t size) {
   void* memory = AllocateRaw(size);
   ++_allocated;
   return memory;
}

void* NodeArena::AllocateRaw(size_t size) {
   size = RoundUp(size);
   if (static_cast<size_t>(_end - _cursor) < size) {
      size_t blockSize = _blocks.empty() ? kFirstBlockSize
                                         : std::min(2 * static_cast<size_t>(_end - _blocks.back()),
                                                    kLargestBlockSize);
      blockSize = std::max(blockSize, size);
      _blocks.reserve(_blocks.size() + 1);
      char* block = static_cast<char*>(::operator new(blockSize));
      _blocks.push_back(block);
      _cursor = block;
      _end = block + blockSize;
   }
   void* memory = _cursor;
   _cursor += size;
   return memory;
}

void NodeArena::Release() { Drop(1); }

void NodeArena::ReleaseCreator() { Drop(kCreatorBias - _allocated); }

void NodeArena::Drop(size_t references) {
   if (_references.fetch_sub(references, std::memory_order_acq_rel) == references) delete this;
}

void* NodeImpl::operator new(size_t size) {
   char* memory = static_cast<char*>(::operator new(kHeaderSize + size));
   *reinterpret_cast<NodeArena**>(memory) = nullptr;
   return memory + kHeaderSize;
}

void* NodeImpl::operator new(size_t size, NodeArena* arena) {
   char* memory = static_cast<char*>(arena->Allocate(kHeaderSize + size));
   *reinterpret_cast<NodeArena**>(memory) = arena;
   return memory + kHeaderSize;
}

void NodeImpl::operator delete(void* node) {
   if (!node) return;
   char* memory = static_cast<char*>(node) - kHeaderSize;
   NodeArena* arena = *reinterpret_cast<NodeArena**>(memory);
   if (arena) {
      arena->Release();
   } else {
      ::operator delete(memory);
   }
}

void NodeImpl::operator delete(void* node, NodeArena*) {
   NodeImpl::operator delete(node);
}

}  // namespace Pelmora::Xml
