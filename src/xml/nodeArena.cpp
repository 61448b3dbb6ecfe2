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

struct NodeArena::Interned {
   explicit Interned(std::string_view name)
       : qualified(name), name(ElementName::FromQualified(name)) {}
   const std::string qualified;
   const ElementName name;
};

NodeArena::~NodeArena() {
   for (Interned* interned : _interned) delete interned;
   for (char* block : _blocks) ::operator delete(block);
}

const ElementName* NodeArena::InternName(std::string_view qualifiedName) {
   auto found = _names.find(qualifiedName);
   if (found != _names.end()) return &found->second->name;
   _interned.reserve(_interned.size() + 1);
   auto* interned = new Interned(qualifiedName);
   _interned.push_back(interned);
   try {
      _names.emplace(interned->qualified, interned);
   } catch (...) {
      // Kept by _interned: found again by no one, freed with the arena.
   }
   return &interned->name;
}

void* NodeArena::Allocate(size_t size) {
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
   ++_allocated;
   return memory;
}

void NodeArena::Release() { Drop(1); }

void NodeArena::ReleaseCreator() {
   // No more names are looked up; the names themselves stay with their elements.
   std::unordered_map<std::string_view, Interned*>().swap(_names);
   Drop(kCreatorBias - _allocated);
}

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
