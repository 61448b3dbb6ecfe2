#pragma once
// Where a configuration's text comes from and goes to. A backend hands out one reader or
// one writer at a time; a writer's text replaces the source only at Commit, and Close
// without Commit throws it away. Not thread-safe: the configuration serialises its I/O.

#include <sys/stat.h>
#include <sys/types.h>

#include <string>

#include "pelmora/io/readerWriter.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Service {

class ConfigBackend : public virtual Object {
public:
   // InProgressException while a reader or writer is open.
   virtual void Open(Ref<Reader>& out) = 0;
   virtual void Open(Ref<Writer>& out) = 0;
   // Puts what the open writer wrote in place of the source.
   virtual void Commit() = 0;
   // Ends the open reader or writer; an uncommitted writer's text is dropped.
   virtual void Close() = 0;
   // Whether the source differs from what the last reader read or the last Commit wrote.
   virtual bool HasChanged() = 0;
};

class FileConfigBackend : public ConfigBackend {
public:
   static constexpr const char* _gzExt = ".gz";
};

// The system calls a file backend writes through. Tests replace one to make a step fail;
// everything else uses the defaults.
struct ConfigFileOps {
   ssize_t (*write)(int fd, const void* data, size_t length);
   int (*fsync)(int fd);
   int (*rename)(const char* from, const char* to);
   static const ConfigFileOps& Posix();
};

// `sizeLimit` counts uncompressed bytes, negative meaning kConfigDefaultSizeLimit; `flags`
// as kConfigFlagGzip. A compressed configuration's path must not contain ".gz"
// (InvalidArgumentException): the extension is added here.
void CreateFileConfigBackend(const std::string& path, int sizeLimit, unsigned flags,
                             Ref<FileConfigBackend>& out);
void CreateFileConfigBackend(const std::string& path, int sizeLimit, unsigned flags,
                             const ConfigFileOps& ops, Ref<FileConfigBackend>& out);
// `text` must outlive the backend; Commit assigns to it.
void CreateStringConfigBackend(std::string& text, Ref<ConfigBackend>& out);

}  // namespace Pelmora::Service
