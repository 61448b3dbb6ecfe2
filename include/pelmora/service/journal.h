#pragma once
// A journal records the steps of a multi-step change to files and directories before they
// are made, so that a change cut short by a crash or power loss can be undone afterwards:
// nothing is left half-done. Journals, entries and providers are not thread-safe; one
// process writes a journal at a time.
//
// File layout: the 23 characters "NORVEX.JOURNAL.VER.1.0.", then records, each a 4-byte
// little-endian length N and N bytes, written with one write each. The first record is the
// JrnlHeader, every later one an entry: its 4-byte operation code, then its fields.
// Integers are 32-bit little-endian, booleans one byte, strings their length plus one
// (4 bytes), their characters and a zero byte.
//
// What the values mean here:
// - JrnlHeader: the first check value is kJrnlHeaderMagic, the second the owner's kind
//   (kJrnlKindFileOps for BasicFileOpsJournal), the third the creation time in seconds.
// - JrnlBeginEntry opens a change; JrnlEndEntry closes it, flag 1 when it was completed
//   and stands, 0 when it was undone.
// - JrnlUndoFormerEntry(n) says that the change opened by the n-th record (the header is
//   record 0) is being undone; an End(0) follows once the undo is complete. An undo cut
//   short is simply run again: every undo step is idempotent.
// - A JrnlStringFieldEntry named "backup" gives the place where the old content of the
//   file of the next JrnlFileEntry removal is kept until the change is over.
//
// A torn last record (a write cut short by power loss: a length running past the end of
// the file, or a tail of zero bytes) is ignored and cut off before anything is appended.

#include <cstdint>
#include <string>
#include <vector>

#include "pelmora/exception/throwable.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Service {

class Logger;

class PELMORA_EXPORT JrnlException : public Exception {
public:
   explicit JrnlException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(JrnlException)
};

constexpr char kJrnlFileHeader[] = "NORVEX.JOURNAL.VER.1.0.";
constexpr unsigned kJrnlFileHeaderLength = 23;
constexpr uint32_t kJrnlHeaderMagic = 0x4C4E524Au;  // "JRNL" read little-endian
constexpr uint32_t kJrnlKindFileOps = 1;

enum JrnlOp : uint32_t {
   kJrnlOpBegin = 1,
   kJrnlOpEnd = 2,
   kJrnlOpUndoFormer = 3,
   kJrnlOpDir = 4,
   kJrnlOpFile = 5,
   kJrnlOpIntField = 6,
   kJrnlOpStringField = 7,
   kJrnlOpLongField = 8,
};

// The kind of file a JrnlFileEntry names.
enum JrnlFileType : uint32_t {
   kJrnlFileRegular = 1,
   kJrnlFileSymlink = 2,
};

// One record after the header. Serialize returns the bytes written and raises
// JrnlException "Serializing Invalid Journal Entry" for an entry that fails
// CheckIntegrity; Deserialize reads a whole record (code included) and raises
// JrnlException for one that is short, too long or malformed.
class PELMORA_EXPORT BaseJrnlEntry : public ObjectImpl {
public:
   explicit BaseJrnlEntry(uint32_t op) : _op(op) {}
   uint32_t GetOp() const { return _op; }
   virtual int Serialize(Writer* writer);
   virtual void Deserialize(char* buffer, unsigned int length);
   virtual bool CheckIntegrity() const { return true; }
   // One line for people: the kind and the fields.
   virtual std::string PrintEntry() const;

   static int SerializePrimitive(Writer* writer, const void* value, unsigned int size);
   static int SerializeString(Writer* writer, const std::string& value);
   // Each reads at `offset` and advances it; JrnlException when the bytes run out.
   static void DeserializePrimitive(const char* buffer, unsigned int length, unsigned int& offset,
                                    void* value, unsigned int size);
   static void DeserializeString(const char* buffer, unsigned int length, unsigned int& offset,
                                 std::string& value);

protected:
   int BaseSerialize(Writer* writer);
   // Checks the code and returns the offset of the first field.
   unsigned int BaseDeserialize(const char* buffer, unsigned int length);
   // JrnlException unless the fields used the record exactly.
   static void CheckConsumed(unsigned int offset, unsigned int length);

private:
   uint32_t _op;
};

class PELMORA_EXPORT JrnlBeginEntry : public BaseJrnlEntry {
public:
   JrnlBeginEntry() : BaseJrnlEntry(kJrnlOpBegin) {}
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);
};

class PELMORA_EXPORT JrnlEndEntry : public BaseJrnlEntry {
public:
   explicit JrnlEndEntry(bool completed = true) : BaseJrnlEntry(kJrnlOpEnd), _completed(completed) {}
   bool IsCompleted() const { return _completed; }
   int Serialize(Writer* writer) override;
   void Deserialize(char* buffer, unsigned int length) override;
   std::string PrintEntry() const override;
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);

private:
   bool _completed;
};

class PELMORA_EXPORT JrnlUndoFormerEntry : public BaseJrnlEntry {
public:
   explicit JrnlUndoFormerEntry(int32_t beginRecord = 0)
      : BaseJrnlEntry(kJrnlOpUndoFormer), _beginRecord(beginRecord) {}
   int32_t GetBeginRecord() const { return _beginRecord; }
   int Serialize(Writer* writer) override;
   void Deserialize(char* buffer, unsigned int length) override;
   std::string PrintEntry() const override;
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);

private:
   int32_t _beginRecord;
};

class PELMORA_EXPORT JrnlDirEntry : public BaseJrnlEntry {
public:
   JrnlDirEntry(bool creation = true, const std::string& path = std::string())
      : BaseJrnlEntry(kJrnlOpDir), _creation(creation), _path(path) {}
   bool IsCreation() const { return _creation; }
   const std::string& GetPath() const { return _path; }
   int Serialize(Writer* writer) override;
   void Deserialize(char* buffer, unsigned int length) override;
   bool CheckIntegrity() const override { return !_path.empty(); }
   std::string PrintEntry() const override;
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);

private:
   bool _creation;
   std::string _path;
};

class PELMORA_EXPORT JrnlFileEntry : public BaseJrnlEntry {
public:
   JrnlFileEntry(bool creation = true, uint32_t type = kJrnlFileRegular,
                 const std::string& path = std::string())
      : BaseJrnlEntry(kJrnlOpFile), _creation(creation), _type(type), _path(path) {}
   bool IsCreation() const { return _creation; }
   uint32_t GetFileType() const { return _type; }
   const std::string& GetPath() const { return _path; }
   int Serialize(Writer* writer) override;
   void Deserialize(char* buffer, unsigned int length) override;
   bool CheckIntegrity() const override { return !_path.empty(); }
   std::string PrintEntry() const override;
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);

private:
   bool _creation;
   uint32_t _type;
   std::string _path;
};

// The field entries share the name; each writes its own value after it.
class PELMORA_EXPORT BaseJrnlFieldEntry : public BaseJrnlEntry {
public:
   BaseJrnlFieldEntry(uint32_t op, const std::string& name) : BaseJrnlEntry(op), _name(name) {}
   const std::string& GetName() const { return _name; }
   bool CheckIntegrity() const override { return !_name.empty(); }

protected:
   int SerializeName(Writer* writer);
   unsigned int DeserializeName(const char* buffer, unsigned int length);

private:
   std::string _name;
};

class PELMORA_EXPORT JrnlIntFieldEntry : public BaseJrnlFieldEntry {
public:
   JrnlIntFieldEntry(const std::string& name = std::string(), int32_t value = 0)
      : BaseJrnlFieldEntry(kJrnlOpIntField, name), _value(value) {}
   int32_t GetValue() const { return _value; }
   int Serialize(Writer* writer) override;
   void Deserialize(char* buffer, unsigned int length) override;
   std::string PrintEntry() const override;
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);

private:
   int32_t _value;
};

class PELMORA_EXPORT JrnlStringFieldEntry : public BaseJrnlFieldEntry {
public:
   JrnlStringFieldEntry(const std::string& name = std::string(), const std::string& value = std::string())
      : BaseJrnlFieldEntry(kJrnlOpStringField, name), _value(value) {}
   const std::string& GetValue() const { return _value; }
   int Serialize(Writer* writer) override;
   void Deserialize(char* buffer, unsigned int length) override;
   std::string PrintEntry() const override;
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);

private:
   std::string _value;
};

class PELMORA_EXPORT JrnlLongFieldEntry : public BaseJrnlFieldEntry {
public:
   JrnlLongFieldEntry(const std::string& name = std::string(), int64_t value = 0)
      : BaseJrnlFieldEntry(kJrnlOpLongField, name), _value(value) {}
   int64_t GetValue() const { return _value; }
   int Serialize(Writer* writer) override;
   void Deserialize(char* buffer, unsigned int length) override;
   std::string PrintEntry() const override;
   static BaseJrnlEntry* CreateObject(Logger* logger, char* buffer, unsigned int length);

private:
   int64_t _value;
};

// The first record. Serialize panics on a null writer ("writer != __null"); Deserialize
// panics on a null or empty buffer ("buffer && len").
class PELMORA_EXPORT JrnlHeader : public ObjectImpl {
public:
   JrnlHeader() = default;
   JrnlHeader(uint32_t check1, uint32_t check2, uint32_t timeStamp, const std::string& id,
              const std::string& data = std::string())
      : _check1(check1), _check2(check2), _timeStamp(timeStamp), _data(data), _id(id) {}

   int Serialize(Writer* writer);
   void Deserialize(const char* buffer, unsigned int length);
   // The id is not empty (the data block may be).
   bool CheckIntegrity() const { return !_id.empty(); }
   bool CheckIntegrity(uint32_t check1, uint32_t check2) const {
      return CheckIntegrity() && _check1 == check1 && _check2 == check2;
   }
   std::string PrintEntry() const;
   void UpgradeTimeStamp(uint32_t timeStamp) { _timeStamp = timeStamp; }

   uint32_t GetCheck1() const { return _check1; }
   uint32_t GetCheck2() const { return _check2; }
   uint32_t GetTimeStamp() const { return _timeStamp; }
   const std::string& GetData() const { return _data; }
   const std::string& GetId() const { return _id; }

private:
   uint32_t _check1 = 0;
   uint32_t _check2 = 0;
   uint32_t _timeStamp = 0;
   std::string _data;
   std::string _id;
};

// Where records are kept. WriteRecord appends one non-empty record (an empty one could
// not be told from a torn one: InvalidArgumentException) and makes it durable before
// returning; ReadRecord hands back the next record in a new[] buffer of length + 1 bytes
// (the caller deletes it), or false at the end (a torn last record counts as the end).
class PELMORA_EXPORT JrnlPersistenceProvider : public virtual Object {
public:
   virtual void WriteRecord(const char* data, unsigned int length) = 0;
   virtual bool ReadRecord(char*& buffer, unsigned int& length) = 0;
   virtual void RewindToStart() = 0;
   // Whether the bytes before the records are the journal's file header.
   virtual bool IsValidFileHeader() = 0;
   // Deletes the journal's storage; the provider is unusable afterwards.
   virtual void Remove() = 0;
   virtual const std::string& GetPath() const = 0;
};

// One file per journal. `create`: make a new file ("The journal already exists" when
// there is one; "Failed to create journal file: %1." when it cannot be made); otherwise
// open an existing one for reading and appending (SystemException when it cannot).
// Failed writes raise "Failed to write to " + path.
PELMORA_EXPORT void CreateJrnlFilePersistenceProvider(const std::string& path, bool create,
                                                      Ref<JrnlPersistenceProvider>& out);

// Reads the file header's 23 bytes (fewer when the file is shorter).
PELMORA_EXPORT std::string GetJrnlFileHeader(const std::string& path);

using JrnlEntryCreator = BaseJrnlEntry* (*)(Logger*, char*, unsigned int);

// A journal: the header and its entries through a provider, with the map from operation
// code to entry creator that reading uses.
class PELMORA_EXPORT BaseJournal : public virtual Object {
public:
   virtual void RegisterEntryCreator(uint32_t op, JrnlEntryCreator creator) = 0;
   virtual void UnregisterEntryCreator(uint32_t op) = 0;
   // Reads the header; JrnlException when the file header or the header record is bad.
   virtual void ReadHeader(Ref<JrnlHeader>& out) = 0;
   // Every entry after the header, in order. JrnlException for an unknown code or a
   // malformed record (a torn last record is left out).
   virtual void GetLogEntries(std::vector<Ref<BaseJrnlEntry>>& out) = 0;
   virtual void AppendEntry(BaseJrnlEntry* entry) = 0;
   virtual JrnlPersistenceProvider* GetProvider() const = 0;
};

// Makes changes to files and directories and journals each step before it is made:
// Begin, then any number of steps, then End. Removed and overwritten files are kept beside
// the journal (journal path + ".bak-N") until End, so the journal must live on the file
// system of the files it changes (else the step fails with SystemException, undone).
// New content is written to ".name.jrnl-tmp" in the file's directory, synced, then
// renamed into place. After a crash, Recover undoes the
// unfinished change in reverse order and leaves finished ones alone; it is idempotent.
// Paths should be absolute: they are replayed as written.
class PELMORA_EXPORT BasicFileOpsJournal : public virtual BaseJournal {
public:
   virtual void Begin() = 0;
   // Completes the change: it stands from here on, and the kept old contents go.
   virtual void End() = 0;
   // Undoes the open change now, as Recover would.
   virtual void Abort() = 0;
   virtual void CreateDirectory(const std::string& path) = 0;
   // Creates every missing directory down to `path`.
   virtual void CreateDirectoryHierarchy(const std::string& path) = 0;
   // `path` must be an empty directory.
   virtual void RemoveDirectory(const std::string& path) = 0;
   // Creates or replaces the file with `content`.
   virtual void WriteFile(const std::string& path, const std::string& content) = 0;
   virtual void RemoveFile(const std::string& path) = 0;
   // Undoes a change left unfinished; returns whether there was one.
   virtual bool Recover() = 0;
   virtual bool InChange() const = 0;
};

// `create` makes a new journal with `id` (JrnlException "The journal already exists" when
// the file is there); otherwise opens the existing journal, whose id is read back.
PELMORA_EXPORT void CreateBasicFileOpsJournal(const std::string& path, bool create, const std::string& id,
                                              Ref<BasicFileOpsJournal>& out);

}  // namespace Pelmora::Service
