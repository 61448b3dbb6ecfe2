// pelmora-journal: shows, checks and recovers file-operation journals.

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "pelmora/exception/throwable.h"
#include "pelmora/service/journal.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

const char kUsage[] =
    "Usage: pelmora-journal COMMAND JOURNAL\n"
    "Shows, checks and recovers a journal of file operations.\n"
    "\n"
    "Commands:\n"
    "  dump JOURNAL     print the header and every entry, one per line\n"
    "  check JOURNAL    exit 0 when JOURNAL is a valid journal, 1 when it is not\n"
    "  recover JOURNAL  undo the change a crash left unfinished, if any\n"
    "  --help           print this text\n"
    "\n"
    "Exit status: 0 success, 1 invalid journal or failure, 2 wrong usage.\n";

int Usage() {
   std::fputs(kUsage, stderr);
   return 2;
}

int Fail(const std::string& message) {
   std::fprintf(stderr, "pelmora-journal: %s\n", message.c_str());
   return 1;
}

void Open(const std::string& path, Ref<BasicFileOpsJournal>& journal) {
   if (GetJrnlFileHeader(path) != std::string(kJrnlFileHeader, kJrnlFileHeaderLength))
      throw JrnlException("Not a journal: " + path);
   CreateBasicFileOpsJournal(path, false, std::string(), journal);
}

int Dump(const std::string& path) {
   Ref<BasicFileOpsJournal> journal;
   Open(path, journal);
   Ref<JrnlHeader> header;
   journal->ReadHeader(header);
   std::vector<Ref<BaseJrnlEntry>> entries;
   journal->GetLogEntries(entries);
   std::printf("0 %s\n", header->PrintEntry().c_str());
   int record = 1;
   for (auto& entry : entries) std::printf("%d %s\n", record++, entry->PrintEntry().c_str());
   return 0;
}

}  // namespace

int main(int argc, char** argv) {
   if (argc == 2 && (std::strcmp(argv[1], "--help") == 0 || std::strcmp(argv[1], "-h") == 0)) {
      std::fputs(kUsage, stdout);
      return 0;
   }
   if (argc != 3) return Usage();
   std::string command = argv[1];
   std::string path = argv[2];
   try {
      if (command == "dump") return Dump(path);
      if (command == "check") {
         Ref<BasicFileOpsJournal> journal;
         Open(path, journal);
         return 0;
      }
      if (command == "recover") {
         Ref<BasicFileOpsJournal> journal;
         Open(path, journal);
         std::puts(journal->Recover() ? "undid the unfinished change" : "nothing to undo");
         return 0;
      }
   } catch (const Throwable& e) {
      return Fail(e.GetMessage());
   }
   return Usage();
}
