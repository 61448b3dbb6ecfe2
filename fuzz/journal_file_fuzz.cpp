// Fuzzes the reading of journal files: the header record and every entry, through the file
// provider and directly. Only JrnlException may come out; recovery is not run, since it
// would act on whatever paths the input names.

#include <cstdint>
#include <cstdlib>
#include <fcntl.h>
#include <string>
#include <unistd.h>
#include <vector>

#include "pelmora/service/journal.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

const std::string& ScratchPath() {
   static const std::string path = "/tmp/pelmora-journal-fuzz-" + std::to_string(::getpid());
   return path;
}

template <class Entry>
void ParseDirectly(const std::string& bytes) {
   std::string copy = bytes;
   Ref<Entry> entry = new Entry();
   try {
      entry->Deserialize(copy.data(), static_cast<unsigned>(copy.size()));
      entry->PrintEntry();
   } catch (const JrnlException&) {
   }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   std::string bytes(reinterpret_cast<const char*>(data), size);
   if (!bytes.empty()) {
      JrnlHeader header;
      try {
         header.Deserialize(bytes.data(), static_cast<unsigned>(bytes.size()));
      } catch (const JrnlException&) {
      }
      ParseDirectly<JrnlBeginEntry>(bytes);
      ParseDirectly<JrnlEndEntry>(bytes);
      ParseDirectly<JrnlUndoFormerEntry>(bytes);
      ParseDirectly<JrnlDirEntry>(bytes);
      ParseDirectly<JrnlFileEntry>(bytes);
      ParseDirectly<JrnlIntFieldEntry>(bytes);
      ParseDirectly<JrnlStringFieldEntry>(bytes);
      ParseDirectly<JrnlLongFieldEntry>(bytes);
   }

   // The file header is rarely guessed: give it most inputs, keep a few without.
   std::string file = (size > 0 && data[0] == 'N') ? bytes : std::string(kJrnlFileHeader) + bytes;
   int fd = ::open(ScratchPath().c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
   if (fd < 0) std::abort();
   if (::write(fd, file.data(), file.size()) != static_cast<ssize_t>(file.size())) std::abort();
   ::close(fd);
   try {
      Ref<BasicFileOpsJournal> journal;
      CreateBasicFileOpsJournal(ScratchPath(), false, std::string(), journal);
      std::vector<Ref<BaseJrnlEntry>> entries;
      journal->GetLogEntries(entries);
      for (auto& entry : entries) entry->PrintEntry();
   } catch (const JrnlException&) {
   }
   ::unlink(ScratchPath().c_str());
   return 0;
}
