#include "pelmora/authorize/sqliteStorage.h"

#include <sqlite3.h>

#include <mutex>

#include "pelmora/authorize/exceptions.h"

namespace Pelmora::Authorize {

namespace {

// Each entry takes the schema from version N to N + 1 and runs in the transaction that
// records the new version.
const char* const kMigrations[] = {
   "CREATE TABLE privileges(id TEXT PRIMARY KEY, group_id TEXT NOT NULL);"
   "CREATE TABLE roles(id INTEGER PRIMARY KEY, name TEXT NOT NULL UNIQUE);"
   "CREATE TABLE role_privileges(role_id INTEGER NOT NULL, privilege_id TEXT NOT NULL,"
   " PRIMARY KEY(role_id, privilege_id));"
   "CREATE TABLE permissions(entity_id TEXT NOT NULL, principal TEXT NOT NULL, is_group INTEGER NOT NULL,"
   " role_id INTEGER NOT NULL, propagate INTEGER NOT NULL, PRIMARY KEY(entity_id, principal, is_group));",
};
static_assert(sizeof(kMigrations) / sizeof(kMigrations[0]) == kSqliteSchemaVersion);

class Statement {
public:
   Statement(sqlite3* db, const char* sql) : _db(db) {
      if (sqlite3_prepare_v2(db, sql, -1, &_stmt, nullptr) != SQLITE_OK) Fail();
   }
   ~Statement() { sqlite3_finalize(_stmt); }
   Statement(const Statement&) = delete;
   Statement& operator=(const Statement&) = delete;

   Statement& Bind(int index, const std::string& text) {
      if (sqlite3_bind_text(_stmt, index, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT) != SQLITE_OK) Fail();
      return *this;
   }
   Statement& Bind(int index, int value) {
      if (sqlite3_bind_int(_stmt, index, value) != SQLITE_OK) Fail();
      return *this;
   }
   // True while rows come.
   bool Step() {
      int rc = sqlite3_step(_stmt);
      if (rc == SQLITE_ROW) return true;
      if (rc != SQLITE_DONE) Fail();
      return false;
   }
   // For the next round of binds and steps.
   void Reset() { sqlite3_reset(_stmt); }
   void Run() {
      while (Step()) {
      }
   }
   std::string Text(int column) {
      const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(_stmt, column));
      return text ? std::string(text, sqlite3_column_bytes(_stmt, column)) : std::string();
   }
   int Int(int column) { return sqlite3_column_int(_stmt, column); }

   [[noreturn]] void Fail() { throw AuthStorageException(std::string("SQLite: ") + sqlite3_errmsg(_db)); }

private:
   sqlite3* _db;
   sqlite3_stmt* _stmt = nullptr;
};

void Exec(sqlite3* db, const char* sql) {
   char* error = nullptr;
   if (sqlite3_exec(db, sql, nullptr, nullptr, &error) != SQLITE_OK) {
      std::string message = std::string("SQLite: ") + (error ? error : sqlite3_errmsg(db));
      sqlite3_free(error);
      throw AuthStorageException(message);
   }
}

class SqliteStorage;

class SqliteTransaction : public virtual AuthTransaction, public ObjectImpl {
public:
   SqliteTransaction(SqliteStorage* storage, std::unique_lock<std::recursive_mutex> lock);
   ~SqliteTransaction() override;
   void Commit() override;
   void Rollback() override;
   bool IsOpen() const { return _open; }
   const SqliteStorage* GetStorage() const { return _storage; }

private:
   SqliteStorage* const _storage;
   std::unique_lock<std::recursive_mutex> _lock;
   bool _open = true;
};

class SqliteStorage : public virtual StorageProvider, public ObjectImpl {
public:
   SqliteStorage(const std::string& path, int busyTimeoutMs) {
      if (sqlite3_open_v2(path.c_str(), &_db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                          nullptr) != SQLITE_OK) {
         std::string message = "SQLite: cannot open " + path + ": " + (_db ? sqlite3_errmsg(_db) : "out of memory");
         sqlite3_close(_db);
         throw AuthStorageException(message);
      }
      try {
         sqlite3_busy_timeout(_db, busyTimeoutMs);
         Exec(_db, "PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL; PRAGMA foreign_keys=ON;");
         Migrate();
      } catch (...) {
         sqlite3_close(_db);
         throw;
      }
   }
   ~SqliteStorage() override { sqlite3_close(_db); }

   sqlite3* Db() const { return _db; }

   void LoadPrivileges(std::vector<PrivilegeDef>& out) override {
      out.clear();
      std::lock_guard<std::recursive_mutex> lock(_mutex);
      Statement select(_db, "SELECT id, group_id FROM privileges ORDER BY id");
      while (select.Step()) out.push_back(PrivilegeDef{select.Text(0), select.Text(1)});
   }

   void LoadRoles(std::vector<RoleData>& out) override {
      out.clear();
      std::lock_guard<std::recursive_mutex> lock(_mutex);
      Statement roles(_db, "SELECT id, name FROM roles ORDER BY id");
      while (roles.Step()) out.push_back(RoleData{roles.Int(0), roles.Text(1), {}});
      Statement privileges(_db, "SELECT privilege_id FROM role_privileges WHERE role_id = ? ORDER BY privilege_id");
      for (RoleData& role : out) {
         privileges.Reset();
         privileges.Bind(1, role.id);
         while (privileges.Step()) role.privilegeIds.push_back(privileges.Text(0));
      }
   }

   void LoadACEs(std::vector<ACEData>& out) override {
      out.clear();
      std::lock_guard<std::recursive_mutex> lock(_mutex);
      Statement select(_db,
                       "SELECT entity_id, principal, is_group, role_id, propagate FROM permissions "
                       "ORDER BY rowid");
      while (select.Step()) {
         out.push_back(ACEData{select.Text(0), select.Text(1), select.Int(2) != 0, select.Int(3), select.Int(4) != 0});
      }
   }

   void BeginTransaction(Ref<AuthTransaction>& out) override {
      std::unique_lock<std::recursive_mutex> lock(_mutex);
      // Immediate: the write lock is taken now, so a busy database fails here and not
      // half-way through the writes.
      Exec(_db, "BEGIN IMMEDIATE");
      out = new SqliteTransaction(this, std::move(lock));
   }

   void StorePrivilege(AuthTransaction* tx, const PrivilegeDef& privilege) override {
      Check(tx);
      Statement(_db, "INSERT OR REPLACE INTO privileges(id, group_id) VALUES(?, ?)")
         .Bind(1, privilege.id)
         .Bind(2, privilege.groupId)
         .Run();
   }

   void RemovePrivilege(AuthTransaction* tx, const std::string& id) override {
      Check(tx);
      Statement(_db, "DELETE FROM privileges WHERE id = ?").Bind(1, id).Run();
      Statement(_db, "DELETE FROM role_privileges WHERE privilege_id = ?").Bind(1, id).Run();
   }

   void StoreRole(AuthTransaction* tx, const RoleData& role) override {
      Check(tx);
      Statement(_db, "INSERT OR REPLACE INTO roles(id, name) VALUES(?, ?)").Bind(1, role.id).Bind(2, role.name).Run();
      Statement(_db, "DELETE FROM role_privileges WHERE role_id = ?").Bind(1, role.id).Run();
      Statement insert(_db, "INSERT OR IGNORE INTO role_privileges(role_id, privilege_id) VALUES(?, ?)");
      for (const std::string& id : role.privilegeIds) {
         insert.Reset();
         insert.Bind(1, role.id).Bind(2, id).Run();
      }
   }

   void RemoveRole(AuthTransaction* tx, int id) override {
      Check(tx);
      Statement(_db, "DELETE FROM role_privileges WHERE role_id = ?").Bind(1, id).Run();
      Statement(_db, "DELETE FROM roles WHERE id = ?").Bind(1, id).Run();
   }

   void StoreACE(AuthTransaction* tx, const ACEData& ace) override {
      Check(tx);
      // An update keeps the row (and so the order in which permissions load).
      Statement update(_db,
                       "UPDATE permissions SET role_id = ?, propagate = ? "
                       "WHERE entity_id = ? AND principal = ? AND is_group = ?");
      update.Bind(1, ace.roleId).Bind(2, ace.propagate ? 1 : 0).Bind(3, ace.entityId).Bind(4, ace.principal);
      update.Bind(5, ace.isGroup ? 1 : 0).Run();
      if (sqlite3_changes(_db) > 0) return;
      Statement(_db,
                "INSERT INTO permissions(entity_id, principal, is_group, role_id, propagate) VALUES(?, ?, ?, ?, ?)")
         .Bind(1, ace.entityId)
         .Bind(2, ace.principal)
         .Bind(3, ace.isGroup ? 1 : 0)
         .Bind(4, ace.roleId)
         .Bind(5, ace.propagate ? 1 : 0)
         .Run();
   }

   void RemoveACE(AuthTransaction* tx, const std::string& entityId, const std::string& principal,
                  bool isGroup) override {
      Check(tx);
      Statement(_db, "DELETE FROM permissions WHERE entity_id = ? AND principal = ? AND is_group = ?")
         .Bind(1, entityId)
         .Bind(2, principal)
         .Bind(3, isGroup ? 1 : 0)
         .Run();
   }

   std::recursive_mutex& Mutex() { return _mutex; }

private:
   void Check(AuthTransaction* tx) {
      auto* sqlite = dynamic_cast<SqliteTransaction*>(tx);
      if (!sqlite || !sqlite->IsOpen() || sqlite->GetStorage() != this) {
         throw AuthStorageException("SQLite: write outside an open transaction of this store");
      }
   }

   int Version() {
      Statement exists(_db, "SELECT count(*) FROM sqlite_master WHERE type = 'table' AND name = 'schema_version'");
      exists.Step();
      if (exists.Int(0) == 0) return 0;
      Statement version(_db, "SELECT version FROM schema_version");
      return version.Step() ? version.Int(0) : 0;
   }

   void Migrate() {
      Exec(_db, "BEGIN IMMEDIATE");
      try {
         int version = Version();
         if (version > kSqliteSchemaVersion) {
            throw AuthStorageException("SQLite: schema version " + std::to_string(version) +
                                       " is newer than this program's " + std::to_string(kSqliteSchemaVersion));
         }
         if (version == 0) Exec(_db, "CREATE TABLE IF NOT EXISTS schema_version(version INTEGER NOT NULL)");
         for (; version < kSqliteSchemaVersion; ++version) Exec(_db, kMigrations[version]);
         Exec(_db, "DELETE FROM schema_version");
         Statement(_db, "INSERT INTO schema_version(version) VALUES(?)").Bind(1, kSqliteSchemaVersion).Run();
         Exec(_db, "COMMIT");
      } catch (...) {
         sqlite3_exec(_db, "ROLLBACK", nullptr, nullptr, nullptr);
         throw;
      }
   }

   sqlite3* _db = nullptr;
   std::recursive_mutex _mutex;
};

SqliteTransaction::SqliteTransaction(SqliteStorage* storage, std::unique_lock<std::recursive_mutex> lock)
   : _storage(storage), _lock(std::move(lock)) {
   _storage->IncRef();
}

SqliteTransaction::~SqliteTransaction() {
   if (_open) {
      sqlite3_exec(_storage->Db(), "ROLLBACK", nullptr, nullptr, nullptr);
   }
   _lock = {};
   _storage->DecRef();
}

void SqliteTransaction::Commit() {
   if (!_open) throw AuthStorageException("SQLite: transaction already ended");
   try {
      Exec(_storage->Db(), "COMMIT");
   } catch (...) {
      // A failed COMMIT may leave the transaction open; it must not outlive this call.
      if (!sqlite3_get_autocommit(_storage->Db())) sqlite3_exec(_storage->Db(), "ROLLBACK", nullptr, nullptr, nullptr);
      _open = false;
      _lock = {};
      throw;
   }
   _open = false;
   _lock = {};
}

void SqliteTransaction::Rollback() {
   if (!_open) return;
   _open = false;
   sqlite3_exec(_storage->Db(), "ROLLBACK", nullptr, nullptr, nullptr);
   _lock = {};
}

}  // namespace

void CreateSqliteStorageProvider(const std::string& path, int busyTimeoutMs, Ref<StorageProvider>& out) {
   out = new SqliteStorage(path, busyTimeoutMs);
}

}  // namespace Pelmora::Authorize
