#pragma once
// Roles, privileges and permissions stored in one SQLite database file. Every
// AuthTransaction is a SQLite transaction (write-ahead log, immediate locking), so a
// crash in the middle of a change leaves the old permissions or the new ones. The file
// is created on first use; older schema versions are migrated when opened.
//
// Schema (version 1):
//   schema_version(version INTEGER NOT NULL)            one row
//   privileges(id TEXT PRIMARY KEY, group_id TEXT NOT NULL)
//   roles(id INTEGER PRIMARY KEY, name TEXT NOT NULL UNIQUE)
//   role_privileges(role_id INTEGER, privilege_id TEXT, PRIMARY KEY(role_id, privilege_id))
//   permissions(entity_id TEXT, principal TEXT, is_group INTEGER, role_id INTEGER NOT NULL,
//               propagate INTEGER NOT NULL, PRIMARY KEY(entity_id, principal, is_group))
//
// One connection; calls are serialised, and a transaction holds the connection from
// BeginTransaction to Commit or Rollback. Thread-safe.

#include <string>

#include "pelmora/authorize/providers.h"
#include "pelmora/object/export.h"

namespace Pelmora::Authorize {

constexpr int kSqliteSchemaVersion = 1;

// Opens (creating) the database at `path`. `busyTimeoutMs` bounds the wait for another
// process's lock. AuthStorageException when the file cannot be opened or migrated, or
// when it was written by a newer schema.
PELMORA_EXPORT void CreateSqliteStorageProvider(const std::string& path, int busyTimeoutMs,
                                                Ref<StorageProvider>& out);

}  // namespace Pelmora::Authorize
