// The node arena and the allocation functions of NodeImpl that choose between it and the
// general heap.

#include "src/xml/nodeArena.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <new>
#include <string_view>
#include <utility>

#include "src/xml/nodeImpl.h"

namespace Pelmora::Xml {
namespace {

// Blocks double from the first size, which suits a request-sized document, up to the
// largest, which keeps block allocation rare while staying below the heap's mmap threshold.
constexpr size_t kFirstBlockSize = 8 * 1024;
constexpr size_t kLargestBlockSize = 64 * 1024;
// Past this much node memory a document is large: its further blocks are mapped from the
// system, one huge page each, so that building takes a page fault per 2 MB rather than
// per 4 KB (the heap gives its top back and refaults it for every document) and reading
// the nodes back misses the address translation cache far less. Only where the system
// hands out huge pages on request: mapped small pages are no better than the heap's.
constexpr size_t kLargeDocumentBytes = 1024 * 1024;
constexpr size_t kMappedBlockSize = 2 * 1024 * 1024;
// Enough for every node kind: a wider unit would only spread the nodes over more memory,
// which building and dropping a large document read through.
constexpr size_t kAlignment = alignof(void*);
static_assert(alignof(DocumentImpl) <= kAlignment && alignof(ElementNodeImpl) <= kAlignment &&
              alignof(TextNodeImpl) <= kAlignment && alignof(CDataNodeImpl) <= kAlignment &&
              alignof(CommentNodeImpl) <= kAlignment &&
              alignof(ProcessingInstructionNodeImpl) <= kAlignment &&
              alignof(ElementName) <= kAlignment);
// Before each node: the arena it came from, or null for the general heap; one alignment
// unit, so that the node itself stays aligned.
constexpr size_t kHeaderSize = kAlignment;

// One first block kept from a dropped arena for the next: a document a request allocates
// and frees at least that block, and a heap request of its size makes the heap tidy its
// small free chunks first.
std::atomic<char*> g_spareFirstBlock{nullptr};

bool HugePagesOnRequest() {
   static const bool offered = [] {
      int fd = open("/sys/kernel/mm/transparent_hugepage/enabled", O_RDONLY | O_CLOEXEC);
      if (fd < 0) return false;
      char text[128];
      ssize_t length = read(fd, text, sizeof(text) - 1);
      close(fd);
      if (length <= 0) return false;
      std::string_view setting(text, static_cast<size_t>(length));
      return setting.find("[always]") != std::string_view::npos ||
             setting.find("[madvise]") != std::string_view::npos;
   }();
   return offered;
}

// A block of kMappedBlockSize aligned to its size, as a huge page needs.
char* MapBlock() {
   size_t span = 2 * kMappedBlockSize;
   void* mapped = mmap(nullptr, span, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
   if (mapped == MAP_FAILED) throw std::bad_alloc();
   char* start = static_cast<char*>(mapped);
   auto address = reinterpret_cast<uintptr_t>(start);
   char* aligned = start + ((kMappedBlockSize - address % kMappedBlockSize) % kMappedBlockSize);
   if (aligned > start) munmap(start, static_cast<size_t>(aligned - start));
   char* end = start + span;
   if (aligned + kMappedBlockSize < end)
      munmap(aligned + kMappedBlockSize, static_cast<size_t>(end - aligned - kMappedBlockSize));
   madvise(aligned, kMappedBlockSize, MADV_HUGEPAGE);  // advice: refused is fine
   return aligned;
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
   size_t first = 0;
   if (_firstBlockIsSpare && !_blocks.empty()) {
      if (char* old = g_spareFirstBlock.exchange(_blocks.front().start, std::memory_order_acq_rel))
         ::operator delete(old);
      first = 1;
   }
   for (size_t i = first; i < _blocks.size(); ++i) {
      if (_blocks[i].mapped) {
         munmap(_blocks[i].start, kMappedBlockSize);
      } else {
         ::operator delete(_blocks[i].start);
      }
   }
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

void NodeArena::StartBlock(size_t size) {
   size_t blockSize = _blocks.empty()
                          ? kFirstBlockSize
                          : std::min(2 * static_cast<size_t>(_end - _blocks.back().start),
                                     kLargestBlockSize);
   bool mapped = _taken >= kLargeDocumentBytes && size <= kMappedBlockSize && HugePagesOnRequest();
   if (mapped) blockSize = kMappedBlockSize;
   blockSize = std::max(blockSize, size);
   _blocks.reserve(_blocks.size() + 1);
   char* block = nullptr;
   if (mapped) {
      block = MapBlock();
   } else if (_blocks.empty() && blockSize == kFirstBlockSize) {
      block = g_spareFirstBlock.exchange(nullptr, std::memory_order_acq_rel);
      _firstBlockIsSpare = true;
   }
   if (!block) block = static_cast<char*>(::operator new(blockSize));
   _blocks.push_back({block, mapped});
   _taken += blockSize;
   _cursor = block;
   _end = block + blockSize;
}

void NodeArena::Release() { Drop(1); }

void NodeArena::Release(size_t count) { Drop(count); }

void NodeArena::ReleaseCreator() {
   _building = false;
   Drop(kCreatorBias - _allocated);
}

void* AllocateNodePart(NodeArena* arena, size_t size) {
   bool fromArena = arena && arena->IsBuilding();
   char* memory = static_cast<char*>(fromArena ? arena->AllocateRaw(kHeaderSize + size)
                                               : ::operator new(kHeaderSize + size));
   *reinterpret_cast<NodeArena**>(memory) = fromArena ? arena : nullptr;
   return memory + kHeaderSize;
}

void FreeNodePart(void* part) {
   char* memory = static_cast<char*>(part) - kHeaderSize;
   if (!*reinterpret_cast<NodeArena**>(memory)) ::operator delete(memory);
}

void NodeArena::Drop(size_t references) {
   if (_references.fetch_sub(references, std::memory_order_acq_rel) == references) delete this;
}

void NodeDisposal::Free(void* node) {
   char* memory = static_cast<char*>(node) - kHeaderSize;
   NodeArena* arena = *reinterpret_cast<NodeArena**>(memory);
   if (!arena) {
      ::operator delete(memory);
      return;
   }
   if (arena != _arena) {
      Flush();
      _arena = arena;
   }
   ++_count;
}

void NodeDisposal::Flush() {
   if (_count) _arena->Release(std::exchange(_count, 0));
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
