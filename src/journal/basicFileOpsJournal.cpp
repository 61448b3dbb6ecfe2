// BaseJournal reads and appends entries through a provider; BasicFileOpsJournal makes file
// and directory changes, each step journaled (and synced) before it is made, and undoes an
// unfinished change after a crash. Every undo step is idempotent, so an undo that is itself
// cut short is simply run again.

#include <cerrno>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <libgen.h>
#include <map>
#include <sys/stat.h>
#include <unistd.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/io/writers.h"
#include "pelmora/service/journal.h"

namespace Pelmora::Service {

namespace {

[[noreturn]] void ThrowErrno(const std::string& what, const std::string& path) {
   int error = errno;
   throw SystemException(error, what + " " + path + ": " + std::strerror(error));
}

std::string Parent(const std::string& path) {
   std::string copy = path;
   return ::dirname(copy.data());
}

std::string BaseName(const std::string& path) {
   std::string copy = path;
   return ::basename(copy.data());
}

// Makes a rename, link, unlink, mkdir or rmdir in `dir` durable.
void SyncDir(const std::string& dir) {
   int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
   if (fd < 0) return;
   ::fsync(fd);
   ::close(fd);
}

bool Exists(const std::string& path, struct stat* st = nullptr) {
   struct stat local;
   return ::lstat(path.c_str(), st ? st : &local) == 0;
}

std::string TempName(const std::string& path) { return Parent(path) + "/." + BaseName(path) + ".jrnl-tmp"; }

class BaseJournalImpl : public virtual BaseJournal, public ObjectImpl {
public:
   explicit BaseJournalImpl(JrnlPersistenceProvider* provider) : _provider(provider) {
      BaseJrnlRegisterEntryCreators();
   }

   void RegisterEntryCreator(uint32_t op, JrnlEntryCreator creator) override { _creators[op] = creator; }
   void UnregisterEntryCreator(uint32_t op) override { _creators.erase(op); }

   void ReadHeader(Ref<JrnlHeader>& out) override {
      if (!_provider->IsValidFileHeader())
         throw JrnlException("Not a journal: " + _provider->GetPath());
      _provider->RewindToStart();
      char* buffer = nullptr;
      unsigned int length = 0;
      if (!_provider->ReadRecord(buffer, length))
         throw JrnlException("Buffer is too small to have a full record. Journal might be corrupt");
      try {
         PersistenceRecordToHeader(buffer, length, out);
      } catch (...) {
         delete[] buffer;
         throw;
      }
      delete[] buffer;
   }

   void GetLogEntries(std::vector<Ref<BaseJrnlEntry>>& out) override {
      Ref<JrnlHeader> header;
      ReadHeader(header);
      out.clear();
      char* buffer = nullptr;
      unsigned int length = 0;
      while (_provider->ReadRecord(buffer, length)) {
         Ref<BaseJrnlEntry> entry;
         try {
            PersistenceRecordToEntry(buffer, length, entry);
         } catch (...) {
            delete[] buffer;
            throw;
         }
         delete[] buffer;
         out.push_back(entry);
      }
   }

   void AppendEntry(BaseJrnlEntry* entry) override {
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      entry->Serialize(writer.Get());
      _provider->WriteRecord(writer->GetString().data(), static_cast<unsigned int>(writer->GetLength()));
      ++_records;
   }

   JrnlPersistenceProvider* GetProvider() const override { return _provider.Get(); }

protected:
   void WriteHeader(JrnlHeader* header) {
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      header->Serialize(writer.Get());
      _provider->WriteRecord(writer->GetString().data(), static_cast<unsigned int>(writer->GetLength()));
      _records = 1;
   }

   void PersistenceRecordToHeader(char* buffer, unsigned int length, Ref<JrnlHeader>& out) {
      if (length == 0)
         throw JrnlException("Buffer is too small to have a full record. Journal might be corrupt");
      Ref<JrnlHeader> header = new JrnlHeader();
      header->Deserialize(buffer, length);
      out = header;
   }

   void PersistenceRecordToEntry(char* buffer, unsigned int length, Ref<BaseJrnlEntry>& out) {
      if (length < 4)
         throw JrnlException("Buffer is too small to have a full record. Journal might be corrupt");
      uint32_t op = 0;
      for (int i = 0; i < 4; ++i) op |= uint32_t(static_cast<unsigned char>(buffer[i])) << (8 * i);
      auto it = _creators.find(op);
      if (it == _creators.end())
         throw JrnlException(MessageFormatter::ASPrint("Unknown journal entry code %1", op));
      out = Ref<BaseJrnlEntry>::Adopt(it->second(nullptr, buffer, length));
   }

   void BaseJrnlRegisterEntryCreators() {
      RegisterEntryCreator(kJrnlOpBegin, &JrnlBeginEntry::CreateObject);
      RegisterEntryCreator(kJrnlOpEnd, &JrnlEndEntry::CreateObject);
      RegisterEntryCreator(kJrnlOpUndoFormer, &JrnlUndoFormerEntry::CreateObject);
   }

   Ref<JrnlPersistenceProvider> _provider;
   std::map<uint32_t, JrnlEntryCreator> _creators;
   // Records written or read so far, the header included: the next record's index.
   int _records = 0;
};

class BasicFileOpsJournalImpl : public virtual BasicFileOpsJournal, public BaseJournalImpl {
public:
   BasicFileOpsJournalImpl(JrnlPersistenceProvider* provider, bool create, const std::string& id)
      : BaseJournalImpl(provider) {
      JrnlRegisterEntryCreators();
      if (create) {
         Ref<JrnlHeader> header =
             new JrnlHeader(kJrnlHeaderMagic, kJrnlKindFileOps, static_cast<uint32_t>(::time(nullptr)), id);
         WriteHeader(header.Get());
      } else {
         Ref<JrnlHeader> header;
         ReadHeader(header);
         if (!header->CheckIntegrity(kJrnlHeaderMagic, kJrnlKindFileOps))
            throw JrnlException("Not a file operations journal: " + provider->GetPath());
         std::vector<Ref<BaseJrnlEntry>> entries;
         GetLogEntries(entries);
         _records = 1 + static_cast<int>(entries.size());
      }
   }

   void Begin() override {
      if (_inChange) throw InvalidStateException("A journaled change is already open");
      _begin = _records;
      Ref<JrnlBeginEntry> entry = new JrnlBeginEntry();
      AppendEntry(entry.Get());
      _inChange = true;
      _backups.clear();
   }

   void End() override {
      RequireChange();
      EndJournal(true);
      // The change stands: the old contents kept for an undo are no longer needed.
      for (const std::string& backup : _backups) {
         ::unlink(backup.c_str());
         SyncDir(Parent(backup));
      }
      _backups.clear();
   }

   void Abort() override {
      RequireChange();
      std::vector<Ref<BaseJrnlEntry>> entries;
      GetLogEntries(entries);
      InsertUndo(entries, _begin);
   }

   void CreateDirectory(const std::string& path) override {
      RequireChange();
      if (Exists(path)) throw AlreadyExistsException(path);
      DirectoryOp(true, path);
   }

   void CreateDirectoryHierarchy(const std::string& path) override {
      RequireChange();
      std::vector<std::string> missing;
      for (std::string p = path; !p.empty() && p != "/" && p != "." && !Exists(p); p = Parent(p))
         missing.push_back(p);
      for (auto it = missing.rbegin(); it != missing.rend(); ++it) DirectoryOp(true, *it);
   }

   void RemoveDirectory(const std::string& path) override {
      RequireChange();
      DirectoryOp(false, path);
   }

   void WriteFile(const std::string& path, const std::string& content) override {
      RequireChange();
      struct stat old;
      bool exists = Exists(path, &old);
      mode_t mode = exists ? (old.st_mode & 07777) : 0644;
      if (exists) {
         // The old content is kept under a second name (a hard link: no copy, and atomic)
         // before anything may replace it.
         std::string backup = BackupName();
         FileOp(false, path, backup);
         if (::link(path.c_str(), backup.c_str()) != 0) ThrowErrno("Failed to keep", path);
         SyncDir(Parent(backup));
      }
      FileOp(true, path, std::string());
      std::string temp = TempName(path);
      int fd = ::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
      if (fd < 0) ThrowErrno("Failed to create", temp);
      size_t done = 0;
      while (done < content.size()) {
         ssize_t n = ::write(fd, content.data() + done, content.size() - done);
         if (n < 0 && errno == EINTR) continue;
         if (n <= 0) {
            ::close(fd);
            ThrowErrno("Failed to write", temp);
         }
         done += size_t(n);
      }
      if (::fsync(fd) != 0) {
         ::close(fd);
         ThrowErrno("Failed to sync", temp);
      }
      ::close(fd);
      if (::rename(temp.c_str(), path.c_str()) != 0) ThrowErrno("Failed to replace", path);
      SyncDir(Parent(path));
   }

   void RemoveFile(const std::string& path) override {
      RequireChange();
      if (!Exists(path)) throw NotFoundException("No such file: " + path);
      std::string backup = BackupName();
      FileOp(false, path, backup);
      if (::rename(path.c_str(), backup.c_str()) != 0) ThrowErrno("Failed to remove", path);
      SyncDir(Parent(backup));
      SyncDir(Parent(path));
   }

   bool Recover() override {
      std::vector<Ref<BaseJrnlEntry>> entries;
      GetLogEntries(entries);
      // Old contents of finished changes whose removal a crash cut short.
      int record = 1;
      int begin = -1;
      std::vector<std::string> kept;
      for (auto& entry : entries) {
         if (entry->GetOp() == kJrnlOpBegin) {
            begin = record;
            kept.clear();
         } else if (entry->GetOp() == kJrnlOpStringField) {
            auto* field = static_cast<JrnlStringFieldEntry*>(entry.Get());
            if (field->GetName() == "backup") kept.push_back(field->GetValue());
         } else if (entry->GetOp() == kJrnlOpEnd) {
            if (static_cast<JrnlEndEntry*>(entry.Get())->IsCompleted())
               for (const std::string& backup : kept) ::unlink(backup.c_str());
            begin = -1;
         }
         ++record;
      }
      _inChange = false;
      if (begin < 0) return false;
      InsertUndo(entries, begin);
      return true;
   }

   bool InChange() const override { return _inChange; }

private:
   void RequireChange() {
      if (!_inChange) throw InvalidStateException("No journaled change is open");
   }

   // Beside the journal, not beside the file: a directory emptied in the same change must
   // be removable.
   std::string BackupName() { return _provider->GetPath() + ".bak-" + std::to_string(_records); }

   void JrnlRegisterEntryCreators() {
      RegisterEntryCreator(kJrnlOpDir, &JrnlDirEntry::CreateObject);
      RegisterEntryCreator(kJrnlOpFile, &JrnlFileEntry::CreateObject);
      RegisterEntryCreator(kJrnlOpIntField, &JrnlIntFieldEntry::CreateObject);
      RegisterEntryCreator(kJrnlOpStringField, &JrnlStringFieldEntry::CreateObject);
      RegisterEntryCreator(kJrnlOpLongField, &JrnlLongFieldEntry::CreateObject);
   }

   void EndJournal(bool completed) {
      Ref<JrnlEndEntry> entry = new JrnlEndEntry(completed);
      AppendEntry(entry.Get());
      _inChange = false;
   }

   void DirectoryOp(bool creation, const std::string& path) {
      Ref<JrnlDirEntry> entry = new JrnlDirEntry(creation, path);
      AppendEntry(entry.Get());
      if (creation ? ::mkdir(path.c_str(), 0755) != 0 : ::rmdir(path.c_str()) != 0)
         ThrowErrno(creation ? "Failed to create directory" : "Failed to remove directory", path);
      SyncDir(Parent(path));
   }

   // A removal names where the old content goes; the record of it precedes the removal.
   void FileOp(bool creation, const std::string& path, const std::string& backup) {
      if (!creation) {
         Ref<JrnlStringFieldEntry> field = new JrnlStringFieldEntry("backup", backup);
         AppendEntry(field.Get());
         _backups.push_back(backup);
      }
      Ref<JrnlFileEntry> entry = new JrnlFileEntry(creation, kJrnlFileRegular, path);
      AppendEntry(entry.Get());
   }

   struct Step {
      Ref<BaseJrnlEntry> entry;
      std::string backup;  // a removal's kept content; a creation's over the same path
   };

   // Undoes the change opened at record `begin`, last step first, then closes it undone.
   void InsertUndo(const std::vector<Ref<BaseJrnlEntry>>& entries, int begin) {
      Ref<JrnlUndoFormerEntry> undo = new JrnlUndoFormerEntry(begin);
      AppendEntry(undo.Get());
      std::vector<Step> steps;
      std::map<std::string, std::string> lastRemoval;
      std::string pendingBackup;
      for (size_t i = size_t(begin); i < entries.size(); ++i) {
         BaseJrnlEntry* entry = entries[i].Get();
         if (entry->GetOp() == kJrnlOpStringField) {
            auto* field = static_cast<JrnlStringFieldEntry*>(entry);
            if (field->GetName() == "backup") pendingBackup = field->GetValue();
         } else if (entry->GetOp() == kJrnlOpFile) {
            auto* file = static_cast<JrnlFileEntry*>(entry);
            if (!file->IsCreation()) {
               steps.push_back({entry, pendingBackup});
               lastRemoval[file->GetPath()] = pendingBackup;
            } else {
               // A creation over a removed (or overwritten) file pairs with that removal.
               auto it = lastRemoval.find(file->GetPath());
               steps.push_back({entry, it == lastRemoval.end() ? std::string() : it->second});
               if (it != lastRemoval.end()) lastRemoval.erase(it);
            }
            pendingBackup.clear();
         } else if (entry->GetOp() == kJrnlOpDir) {
            steps.push_back({entry, std::string()});
         }
      }
      for (auto it = steps.rbegin(); it != steps.rend(); ++it) UndoStep(*it);
      _backups.clear();
      EndJournal(false);
   }

   void UndoStep(const Step& step) {
      if (step.entry->GetOp() == kJrnlOpDir) {
         auto* dir = static_cast<JrnlDirEntry*>(step.entry.Get());
         const std::string& path = dir->GetPath();
         if (dir->IsCreation()) {
            if (::rmdir(path.c_str()) != 0 && errno != ENOENT) ThrowErrno("Failed to remove directory", path);
         } else if (!Exists(path) && ::mkdir(path.c_str(), 0755) != 0) {
            ThrowErrno("Failed to create directory", path);
         }
         SyncDir(Parent(path));
         return;
      }
      auto* file = static_cast<JrnlFileEntry*>(step.entry.Get());
      const std::string& path = file->GetPath();
      if (file->IsCreation()) {
         // With the old content already put back (its kept name gone), the file at `path`
         // is the old one and stays.
         if (!step.backup.empty() && !Exists(step.backup)) return;
         ::unlink(TempName(path).c_str());
         if (::unlink(path.c_str()) != 0 && errno != ENOENT) ThrowErrno("Failed to remove", path);
      } else {
         struct stat kept, current;
         if (step.backup.empty() || !Exists(step.backup, &kept)) return;
         if (Exists(path, &current) && current.st_ino == kept.st_ino && current.st_dev == kept.st_dev) {
            ::unlink(step.backup.c_str());  // never replaced: two names of one file
         } else if (::rename(step.backup.c_str(), path.c_str()) != 0) {
            ThrowErrno("Failed to restore", path);
         }
         SyncDir(Parent(step.backup));
      }
      SyncDir(Parent(path));
   }

   bool _inChange = false;
   int _begin = -1;
   std::vector<std::string> _backups;
};

}  // namespace

void CreateBasicFileOpsJournal(const std::string& path, bool create, const std::string& id,
                               Ref<BasicFileOpsJournal>& out) {
   Ref<JrnlPersistenceProvider> provider;
   CreateJrnlFilePersistenceProvider(path, create, provider);
   out = new BasicFileOpsJournalImpl(provider.Get(), create, id);
}

}  // namespace Pelmora::Service
