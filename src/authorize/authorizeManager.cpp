#include "src/authorize/authorizeManager.h"

#include <algorithm>

#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/service/logMacros.h"
#include "src/authorize/authLog.h"

namespace Pelmora::Authorize {

using Service::Logger;

namespace {

// The manager locks the calling thread holds, innermost last; a thread holds few.
struct HeldLock {
   const ManagerLock* lock;
   bool write;
};
constexpr int kMaxHeld = 8;
thread_local HeldLock t_held[kMaxHeld];
thread_local int t_heldCount = 0;

const HeldLock* FindHeld(const ManagerLock* lock) {
   for (int i = t_heldCount - 1; i >= 0; --i) {
      if (t_held[i].lock == lock) return &t_held[i];
   }
   return nullptr;
}

void PushHeld(const ManagerLock* lock, bool write) {
   PELMORA_VERIFY(t_heldCount < kMaxHeld);
   t_held[t_heldCount++] = HeldLock{lock, write};
}

}  // namespace

ManagerLock::ManagerLock() {
   pthread_rwlockattr_t attr;
   pthread_rwlockattr_init(&attr);
   pthread_rwlockattr_setkind_np(&attr, PTHREAD_RWLOCK_PREFER_WRITER_NONRECURSIVE_NP);
   pthread_rwlock_init(&_lock, &attr);
   pthread_rwlockattr_destroy(&attr);
}

ManagerLock::~ManagerLock() { pthread_rwlock_destroy(&_lock); }

void ManagerLock::ReadLock() {
   PELMORA_VERIFY(FindHeld(this) == nullptr);
   pthread_rwlock_rdlock(&_lock);
   PushHeld(this, false);
}

void ManagerLock::WriteLock() {
   PELMORA_VERIFY(FindHeld(this) == nullptr);
   pthread_rwlock_wrlock(&_lock);
   PushHeld(this, true);
}

void ManagerLock::Unlock() {
   int i = t_heldCount - 1;
   while (i >= 0 && t_held[i].lock != this) --i;
   PELMORA_VERIFY(i >= 0);
   for (; i + 1 < t_heldCount; ++i) t_held[i] = t_held[i + 1];
   --t_heldCount;
   pthread_rwlock_unlock(&_lock);
}

bool ManagerLock::IsReadLocked() const {
   const HeldLock* held = FindHeld(this);
   return held && !held->write;
}

bool ManagerLock::IsWriteLocked() const {
   const HeldLock* held = FindHeld(this);
   return held && held->write;
}

class PELMORA_SCOPED_CAPABILITY AuthorizeManagerImpl::ReadGuard {
public:
   explicit ReadGuard(ManagerLock* lock) PELMORA_ACQUIRE_SHARED(lock) : _lock(lock) { _lock->ReadLock(); }
   ~ReadGuard() PELMORA_RELEASE_GENERIC() { _lock->Unlock(); }
   ReadGuard(const ReadGuard&) = delete;
   ReadGuard& operator=(const ReadGuard&) = delete;

private:
   ManagerLock* _lock;
};

class PELMORA_SCOPED_CAPABILITY AuthorizeManagerImpl::WriteGuard {
public:
   explicit WriteGuard(ManagerLock* lock) PELMORA_ACQUIRE(lock) : _lock(lock) { _lock->WriteLock(); }
   ~WriteGuard() PELMORA_RELEASE() { _lock->Unlock(); }
   WriteGuard(const WriteGuard&) = delete;
   WriteGuard& operator=(const WriteGuard&) = delete;

private:
   ManagerLock* _lock;
};

namespace {

class AnonymousUser : public virtual UserInfo, public ObjectImpl {
public:
   const std::string& GetName() const override { return _name; }

private:
   const std::string _name = kAnonymousUser;
};

class AnonymousToken : public virtual AuthTokenHelper, public ObjectImpl {
public:
   UserInfo* GetUserInfo() const override { return _user.Get(); }
   UserDirectory* GetUserDirectory() const override { return nullptr; }

private:
   const Ref<UserInfo> _user{new AnonymousUser()};
};

class StatsPublisher : public virtual PerfCounter::GroupPublisher, public ObjectImpl {
public:
   explicit StatsPublisher(AuthorizeStats* stats) : _stats(stats) {}
   void CollectValues(RefVector<PerfCounter::Metadata>& metadata, std::vector<PerfCounter::Value>& values) override {
      const long long hits = _stats->cacheHits.load();
      const long long misses = _stats->cacheMisses.load();
      const long long read[] = {hits + misses, hits, misses, _stats->sessions.load()};
      values.clear();
      for (size_t i = 0; i < metadata.size() && i < 4; ++i) values.emplace_back(read[i]);
   }

private:
   const Ref<AuthorizeStats> _stats;
};

std::string Describe(const ACEData& data) {
   return data.entityId + ":" + (data.isGroup ? "group:" : "user:") + data.principal;
}

}  // namespace

void CreateAnonymousToken(Ref<AuthTokenHelper>& out) { out = new AnonymousToken(); }

AuthorizeManagerImpl::AuthorizeManagerImpl() = default;

AuthorizeManagerImpl::~AuthorizeManagerImpl() {
   if (_initialized) SetAuthLog(nullptr);
}

UserValidationResult AuthorizeManagerImpl::CheckPrincipal(const std::string& name, bool isGroup) {
   // The anonymous principal is ours, not the directory's.
   if (!isGroup && name == kAnonymousUser) return USER_VALID;
   return _directory->ValidatePrincipal(name, isGroup);
}

void AuthorizeManagerImpl::RequireInit() const {
   if (!_initialized) throw NotInitializedException("Authorize manager is not initialized");
}

void AuthorizeManagerImpl::PublishCounters() {
   using PerfCounter::Metadata;
   RefVector<Metadata> metadata{new Metadata(kCounterChecks, Metadata::TYPE_COUNTER),
                                new Metadata(kCounterCacheHits, Metadata::TYPE_COUNTER),
                                new Metadata(kCounterCacheMisses, Metadata::TYPE_COUNTER),
                                new Metadata(kCounterSessions, Metadata::TYPE_GAUGE)};
   try {
      PerfCounter::GetCounterRegistry()->RegisterGroup(metadata, new StatsPublisher(_stats.Get()), _counters);
   } catch (const Exception& e) {
      // Another manager of the process publishes them already.
      PELMORA_LOG_WARNING(_logger.Get(), "Authorize manager publishes no counters: %1", e.what());
   }
}

void AuthorizeManagerImpl::Reset() {
   if (_counters) _counters->Unregister();
   _counters.Reset();
   _stats->sessions = 0;
   _initialized = false;
   _users.Clear();
   _acls.clear();
   _roles = Roles();
   _privileges = PrivilegeTable();
   _directory.Reset();
   _storage.Reset();
   _model.Reset();
   _rootId.clear();
   SetAuthLog(nullptr);
   _logger.Reset();
}

// ---- start-up -----------------------------------------------------------------------

void AuthorizeManagerImpl::Init(UserDirectory* userDirectory, StorageProvider* storageProvider,
                                AppModelProvider* appModelProvider, Logger* logger,
                                Service::Config::View* config) {
   PELMORA_VERIFY(userDirectory != NULL);
   PELMORA_VERIFY(storageProvider != NULL);
   PELMORA_VERIFY(appModelProvider != NULL);
   WriteGuard guard(&_lock);
   if (_initialized) throw AlreadyInitializedException();
   _directory = userDirectory;
   _storage = storageProvider;
   _model = appModelProvider;
   _logger = logger ? logger : Service::GetDefaultLogger();
   SetAuthLog(_logger.Get());
   try {
      if (config) {
         unsigned maxEntries = kDefaultMaxEntityCache;
         config->Get(kConfigMaxEntityCache, &maxEntries);
         _maxEntries = maxEntries;
         config->Get(kConfigDefaultAdmin, &_defaultAdmin);
      }
      Ref<AuthEntity> root;
      _model->GetRootEntity(root);
      _rootId = root ? root->GetId() : std::string();
      LoadRoles();
      LoadACEs();
      _initialized = true;
      PublishCounters();
   } catch (const Exception& e) {
      PELMORA_LOG_ERROR(_logger.Get(), "[Auth] Failed to initialize: <%1>", e.what());
      Reset();
      throw;
   }
}

void AuthorizeManagerImpl::LoadRoles() {
   _privileges = PrivilegeTable();
   std::vector<PrivilegeDef> privileges;
   _storage->LoadPrivileges(privileges);
   for (const PrivilegeDef& def : privileges) {
      try {
         _privileges.Add(def);
      } catch (const Exception& e) {
         PELMORA_LOG_WARNING(_logger.Get(), "Ignoring stored privilege %1: %2", def.id, e.what());
      }
   }
   _roles.SetupDefaultRoles(_privileges.Known());
   std::vector<RoleData> roles;
   _storage->LoadRoles(roles);
   for (const RoleData& data : roles) {
      if (data.id <= 0 || data.name.empty() || _roles.Find(data.id) || _roles.FindByName(data.name)) {
         PELMORA_LOG_WARNING(_logger.Get(), "Ignoring stored role %1 '%2'", data.id, data.name);
         continue;
      }
      PrivSet set;
      for (const std::string& id : data.privilegeIds) {
         if (Privilege* privilege = _privileges.Find(id)) {
            set.Set(privilege->GetIndex());
         } else {
            PELMORA_LOG_WARNING(_logger.Get(), "Role referred to invalid privilege %1, ignoring", id);
         }
      }
      _roles.Add(new Role(data.id, data.name, set));
   }
}

std::string AuthorizeManagerImpl::ValidateNewACE(const ACEData& data, UserValidationResult& validation) {
   validation = USER_VALID;
   try {
      if (data.entityId.empty()) return "unknown entity";
      if (data.principal.empty()) return "user " + data.principal + " not found";
      Ref<AuthEntity> entity;
      if (!_model->FindEntity(data.entityId, entity)) return "entity " + data.entityId + " not found";
      if (!_roles.Find(data.roleId)) return "role with id " + std::to_string(data.roleId) + " not found";
      ACL* acl = FindACL(data.entityId);
      if (acl && acl->FindEntry(data.principal, data.isGroup)) return "permission already exists";
      validation = CheckPrincipal(data.principal, data.isGroup);
      if (validation == USER_NOT_FOUND) return "user " + data.principal + " not found";
      return std::string();
   } catch (const Exception&) {
      return "unknown error";
   }
}

void AuthorizeManagerImpl::AddLoaded(const ACEData& data, UserValidationResult validation) {
   Ref<ACE> ace;
   ACE::CreateACE(data.roleId, data.principal, data.isGroup, _roles.Find(data.roleId), data.propagate, ace,
                  &validation);
   GetOrCreateACL(data.entityId).AddACE(ace.Get());
}

void AuthorizeManagerImpl::LoadACEs() {
   _acls.clear();
   std::vector<ACEData> stored;
   _storage->LoadACEs(stored);
   std::vector<ACEData> invalid;
   std::vector<ACEData> kept;
   for (const ACEData& data : stored) {
      UserValidationResult validation;
      std::string reason = ValidateNewACE(data, validation);
      if (!reason.empty()) {
         PELMORA_LOG_WARNING(_logger.Get(), "Removing invalid permission %1: %2", Describe(data), reason);
         invalid.push_back(data);
         continue;
      }
      if (validation == USER_UNRESOLVED) {
         PELMORA_LOG_WARNING(_logger.Get(),
                             "Warning, existence of %1 \"%2\" unknown, permission may not be effective until it is resolved.",
                             data.isGroup ? "group" : "user", data.principal);
      }
      AddLoaded(data, validation);
      kept.push_back(data);
   }
   if (!invalid.empty()) {
      // A store keyed by entity and principal removes a kept permission together with an
      // invalid one of the same key; those are written back in the same transaction.
      auto sameKey = [](const ACEData& a, const ACEData& b) {
         return a.entityId == b.entityId && a.principal == b.principal && a.isGroup == b.isGroup;
      };
      try {
         Persist([&](AuthTransaction* tx) {
            for (const ACEData& data : invalid) _storage->RemoveACE(tx, data.entityId, data.principal, data.isGroup);
            for (const ACEData& data : kept) {
               if (std::any_of(invalid.begin(), invalid.end(), [&](const ACEData& bad) { return sameKey(bad, data); })) {
                  _storage->StoreACE(tx, data);
               }
            }
         });
      } catch (const Exception& e) {
         PELMORA_LOG_ERROR(_logger.Get(), "Failed to remove invalid permissions from storage: %1", e.what());
      }
   }
   if (_acls.empty()) CreateDefaultPermission();
}

void AuthorizeManagerImpl::CreateDefaultPermission() {
   Logger* log = _logger.Get();
   const char* noRules = "Cannot start authorize - system has no access rules";
   ACEData data{_rootId, _defaultAdmin, false, kRoleAdmin, true};
   Ref<ACE> ace;
   UserValidationResult validation = USER_VALID;
   try {
      Ref<AuthEntity> root;
      if (_rootId.empty() || !_model->FindEntity(_rootId, root)) throw AuthEntityNotFoundException(_rootId);
      Role* admin = _roles.Find(kRoleAdmin);
      if (!admin) throw AuthRoleNotFoundException(kRoleAdmin);
      validation = CheckPrincipal(_defaultAdmin, false);
      if (validation == USER_NOT_FOUND) throw AuthUserNotFoundException(_defaultAdmin, false);
      ACL* acl = FindACL(_rootId);
      if (acl && acl->FindEntry(_defaultAdmin, false)) throw AuthAlreadyExistsException();
      ACE::CreateACE(kRoleAdmin, _defaultAdmin, false, admin, true, ace, &validation);
   } catch (const AuthUserNotFoundException&) {
      PELMORA_LOG_ERROR(log, "Failed to add default permission: user %1 not found", _defaultAdmin);
   } catch (const AuthEntityNotFoundException&) {
      PELMORA_LOG_ERROR(log, "Failed to add default permission: root entity not found");
   } catch (const AuthRoleNotFoundException&) {
      PELMORA_LOG_ERROR(log, "Failed to add default permission: admin role not found");
   } catch (const AuthAlreadyExistsException&) {
      PELMORA_LOG_ERROR(log, "Failed to add default permission: permission already exists");
   } catch (const Exception&) {
      PELMORA_LOG_ERROR(log, "Failed to add default permission");
   }
   if (!ace) {
      PELMORA_LOG_ERROR(log, "Failed to generate default permission id - system has no access rules");
      PELMORA_LOG_ERROR(log, noRules);
      throw AuthException(noRules);
   }
   try {
      Persist([&](AuthTransaction* tx) { _storage->StoreACE(tx, data); });
   } catch (const Exception&) {
      PELMORA_LOG_ERROR(log, "Failed to store default permission - system has no access rules");
      PELMORA_LOG_ERROR(log, noRules);
      throw AuthException(noRules);
   }
   GetOrCreateACL(_rootId).AddACE(ace.Get());
   PELMORA_LOG_INFO(log, "Added default permission: Admin on %1 for %2", _rootId, _defaultAdmin);
}

void AuthorizeManagerImpl::Shutdown() {
   WriteGuard guard(&_lock);
   Reset();
}

UserDirectory* AuthorizeManagerImpl::GetUserDirectory() {
   ReadGuard guard(&_lock);
   return _directory.Get();
}

StorageProvider* AuthorizeManagerImpl::GetStorageProvider() {
   ReadGuard guard(&_lock);
   return _storage.Get();
}

AppModelProvider* AuthorizeManagerImpl::GetAppModelProvider() {
   ReadGuard guard(&_lock);
   return _model.Get();
}

// ---- sessions -----------------------------------------------------------------------

void AuthorizeManagerImpl::AddConnection(Session* session, const std::string& user, Ref<AuthTokenHelper> token,
                                         bool privileged) {
   if (!token) GetAuthToken(user, token);
   WriteGuard guard(&_lock);
   RequireInit();
   UserData* data = _users.Register(session, user, token.Get(), privileged, _maxEntries.load());
   _stats->sessions = static_cast<long long>(_users.SessionCount());
   RecomputeUser(data);
}

void AuthorizeManagerImpl::RemoveConnection(Session* session) {
   WriteGuard guard(&_lock);
   _users.Release(session);
   _stats->sessions = static_cast<long long>(_users.SessionCount());
}

std::string AuthorizeManagerImpl::GetUser(Session* session) {
   ReadGuard guard(&_lock);
   UserData* data = _users.GetUserData(session);
   return data ? data->GetUser() : std::string();
}

void AuthorizeManagerImpl::GetAuthToken(const std::string& user, Ref<AuthTokenHelper>& out) {
   if (user == kAnonymousUser) {
      CreateAnonymousToken(out);
      return;
   }
   Ref<UserDirectory> directory;
   {
      ReadGuard guard(&_lock);
      RequireInit();
      directory = _directory;
   }
   directory->CreateAuthToken(user, out);
}

// ---- checks -------------------------------------------------------------------------

unsigned AuthorizeManagerImpl::PrivilegeIndex(const std::string& privilegeId) const {
   Privilege* privilege = _privileges.Find(privilegeId);
   if (!privilege) throw AuthPrivilegeNotFoundException(privilegeId);
   return privilege->GetIndex();
}

ACL* AuthorizeManagerImpl::FindACL(const std::string& entityId) const {
   auto it = _acls.find(entityId);
   return it == _acls.end() ? nullptr : it->second.Get();
}

ACL& AuthorizeManagerImpl::GetOrCreateACL(const std::string& entityId) {
   Ref<ACL>& acl = _acls[entityId];
   if (!acl) acl = new ACL();
   return *acl;
}

Ref<EntityAccess> AuthorizeManagerImpl::FindParentAccess(const std::string& user, AuthTokenHelper* token,
                                                         const std::string& entityId, UserData* cache) {
   PELMORA_VERIFY(IsReadLocked() || IsWriteLocked());
   struct Step {
      const std::string* id;
      Ref<EntityAccess> own;
      Ref<EntityAccess> propagated;
      bool applied;
   };
   ParentChain chain;
   _model->GetParentChain(entityId, chain);
   std::vector<Step> steps;
   Ref<EntityAccess> found;
   for (const std::string& id : chain) {
      UserData::Cached cached;
      if (cache && cache->Find(id, cached)) {
         found = cached.propagated;
         break;
      }
      Step step{&id, nullptr, nullptr, false};
      if (ACL* acl = FindACL(id)) step.applied = acl->GetAccessForUser(user, token, step.own, step.propagated);
      steps.push_back(step);
      if (step.propagated) {
         found = step.propagated;
         break;
      }
   }
   if (!found) found = Roles::GetNoAccessEntityAccess();
   if (cache) {
      // The ancestors walked are known now too: fill them from the top down.
      Ref<EntityAccess> inherited = found;
      for (auto it = steps.rbegin(); it != steps.rend(); ++it) {
         UserData::Cached entry{it->applied ? it->own : inherited, it->propagated ? it->propagated : inherited};
         cache->Store(*it->id, entry);
         inherited = entry.propagated;
      }
   }
   return found;
}

Ref<EntityAccess> AuthorizeManagerImpl::ComputeAccess(const std::string& user, AuthTokenHelper* token,
                                                      const std::string& entityId, UserData* cache) {
   UserData::Cached cached;
   if (cache && cache->Find(entityId, cached)) return cached.own;
   Ref<EntityAccess> own;
   Ref<EntityAccess> propagated;
   bool applied = false;
   if (ACL* acl = FindACL(entityId)) applied = acl->GetAccessForUser(user, token, own, propagated);
   if (!applied || !propagated) {
      Ref<EntityAccess> inherited;
      if (entityId == _rootId) {
         inherited = Roles::GetNoAccessEntityAccess();
      } else {
         inherited = FindParentAccess(user, token, entityId, cache);
      }
      if (!applied) own = inherited;
      if (!propagated) propagated = inherited;
   }
   if (cache) cache->Store(entityId, UserData::Cached{own, propagated});
   return own;
}

bool AuthorizeManagerImpl::Check(Session* session, AuthEntity* entity, unsigned index, bool useCache) {
   bool privileged = false;
   UserData* data = _users.GetUserData(session, &privileged);
   if (!data) {
      PELMORA_LOG_ERROR(AuthLog(), "Failed to retrieve user data! User: [%1]", std::string());
      return false;
   }
   if (privileged) return true;
   if (!entity) return false;
   const std::string& id = entity->GetId();
   bool allowed = false;
   if (useCache && data->TestCached(id, index, allowed)) {
      _stats->cacheHits.fetch_add(1, std::memory_order_relaxed);
      return allowed;
   }
   _stats->cacheMisses.fetch_add(1, std::memory_order_relaxed);
   try {
      return ComputeAccess(data->GetUser(), data->GetToken(), id, useCache ? data : nullptr)->HasPrivilege(index);
   } catch (const AuthEntityNotFoundException&) {
      return false;
   }
}

bool AuthorizeManagerImpl::HasPrivilege(Session* session, const std::string& privilegeId) {
   ReadGuard guard(&_lock);
   RequireInit();
   unsigned index = PrivilegeIndex(privilegeId);
   Ref<AuthEntity> root;
   if (!_model->FindEntity(_rootId, root)) return false;
   return Check(session, root.Get(), index, true);
}

bool AuthorizeManagerImpl::HasRootAccess(Session* session) {
   if (!session) return true;
   ReadGuard guard(&_lock);
   UserData* data = _users.GetUserData(session);
   if (!data) return false;
   return data->HasRootAccess() || _users.IsPrivileged(session);
}

bool AuthorizeManagerImpl::HasEntityPrivilege(Session* session, AuthEntity* entity, const std::string& privilegeId) {
   ReadGuard guard(&_lock);
   RequireInit();
   return Check(session, entity, PrivilegeIndex(privilegeId), true);
}

bool AuthorizeManagerImpl::HasEntityPrivilege(const std::string& user, AuthEntity* entity,
                                              const std::string& privilegeId) {
   Ref<AuthTokenHelper> token;
   try {
      GetAuthToken(user, token);
   } catch (const AuthException&) {
      return false;
   }
   ReadGuard guard(&_lock);
   RequireInit();
   unsigned index = PrivilegeIndex(privilegeId);
   if (!entity) return false;
   try {
      return ComputeAccess(user, token.Get(), entity->GetId(), nullptr)->HasPrivilege(index);
   } catch (const AuthEntityNotFoundException&) {
      return false;
   }
}

void AuthorizeManagerImpl::HasEntityPrivilegeList(Session* session, const EntityPrivilegeList& list,
                                                  std::vector<bool>& results) {
   results.assign(list.size(), false);
   ReadGuard guard(&_lock);
   RequireInit();
   for (size_t i = 0; i < list.size(); ++i) {
      results[i] = Check(session, list[i].first, PrivilegeIndex(list[i].second), true);
   }
}

void AuthorizeManagerImpl::HasEntityPrivilegeListUncached(Session* session, const EntityPrivilegeList& list,
                                                          std::vector<bool>& results) {
   results.assign(list.size(), false);
   ReadGuard guard(&_lock);
   RequireInit();
   for (size_t i = 0; i < list.size(); ++i) {
      results[i] = Check(session, list[i].first, PrivilegeIndex(list[i].second), false);
   }
}

void AuthorizeManagerImpl::GetEntityRoles(Session* session, AuthEntity* entity, std::vector<int>& roleIds) {
   roleIds.clear();
   ReadGuard guard(&_lock);
   RequireInit();
   UserData* data = _users.GetUserData(session);
   if (!data || !entity) return;
   try {
      roleIds = ComputeAccess(data->GetUser(), data->GetToken(), entity->GetId(), data)->GetRoleIds();
   } catch (const AuthEntityNotFoundException&) {
   }
}

size_t AuthorizeManagerImpl::CachedEntryCount(Session* session) {
   ReadGuard guard(&_lock);
   UserData* data = _users.GetUserData(session);
   return data ? data->Size() : 0;
}

// ---- changes ------------------------------------------------------------------------

void AuthorizeManagerImpl::Persist(const std::function<void(AuthTransaction*)>& writes) {
   Ref<AuthTransaction> tx;
   try {
      _storage->BeginTransaction(tx);
      writes(tx.Get());
      tx->Commit();
   } catch (const Exception& e) {
      if (tx) {
         try {
            tx->Rollback();
         } catch (const Exception&) {
         }
      }
      if (dynamic_cast<const AuthStorageException*>(&e)) throw;
      throw AuthStorageException(e.what());
   }
}

void AuthorizeManagerImpl::ForEachACE(const std::function<void(const std::string&, ACE*)>& visit) const {
   for (const auto& [id, acl] : _acls) {
      for (const Ref<ACE>& ace : acl->GetEntries()) visit(id, ace.Get());
   }
}

size_t AuthorizeManagerImpl::CountRootAdminUsers() const {
   ACL* acl = FindACL(_rootId);
   if (!acl) return 0;
   return std::count_if(acl->GetEntries().begin(), acl->GetEntries().end(), [](const Ref<ACE>& ace) {
      return ace->IsUser() && ace->GetRole()->GetId() == kRoleAdmin;
   });
}

bool AuthorizeManagerImpl::IsLastFullAdminUser(const std::string& entityId, const std::string& principal,
                                               bool isGroup) const {
   if (entityId != _rootId || isGroup) return false;
   ACL* acl = FindACL(entityId);
   ACE* ace = acl ? acl->FindEntry(principal, false) : nullptr;
   return ace && ace->GetRole()->GetId() == kRoleAdmin && CountRootAdminUsers() == 1;
}

void AuthorizeManagerImpl::AfterChange(const std::vector<std::string>& users) {
   try {
      Recompute(users);
   } catch (const Exception& e) {
      PELMORA_LOG_ERROR(AuthLog(), "[Authorize] Failed to notify effective role changes: %1", e.what());
   }
}

void AuthorizeManagerImpl::RecomputeUser(UserData* data) {
   data->Clear();
   try {
      bool root = false;
      if (!_rootId.empty()) {
         const std::vector<int>& roles = ComputeAccess(data->GetUser(), data->GetToken(), _rootId, data)->GetRoleIds();
         root = std::find(roles.begin(), roles.end(), kRoleAdmin) != roles.end();
      }
      data->SetRootAccess(root);
   } catch (const Exception& e) {
      data->SetRootAccess(false);
      PELMORA_LOG_ERROR(AuthLog(), "[Authorize] Failed to recalculate permissions for user session %1: %2",
                        data->GetUser(), e.what());
   }
}

void AuthorizeManagerImpl::Recompute(const std::vector<std::string>& users) {
   std::vector<Ref<UserData>> all;
   _users.GetAllUserData(all);
   for (const Ref<UserData>& data : all) {
      if (users.empty() || std::find(users.begin(), users.end(), data->GetUser()) != users.end()) {
         RecomputeUser(data.Get());
      }
   }
}

void AuthorizeManagerImpl::NotifyChange(const std::vector<std::string>& users) {
   WriteGuard guard(&_lock);
   AfterChange(users);
}

void AuthorizeManagerImpl::NotifyEntityMove(const std::vector<std::string>& entityIds) {
   if (entityIds.empty()) return;
   WriteGuard guard(&_lock);
   // A moved subtree inherits from new ancestors; what any user had cached below it is
   // stale, and finding those entries costs more than recomputing them on demand.
   AfterChange();
}

void AuthorizeManagerImpl::ClearUserCaches() {
   WriteGuard guard(&_lock);
   std::vector<Ref<UserData>> all;
   _users.GetAllUserData(all);
   for (const Ref<UserData>& data : all) data->Clear();
}

void AuthorizeManagerImpl::UpdateMaxUserCacheEntries(unsigned maxEntries) {
   WriteGuard guard(&_lock);
   _maxEntries = maxEntries;
   std::vector<Ref<UserData>> all;
   _users.GetAllUserData(all);
   for (const Ref<UserData>& data : all) data->SetMaxEntries(maxEntries);
}

// ---- roles and privileges -----------------------------------------------------------

void AuthorizeManagerImpl::CheckRoleName(const std::string& name, int exceptId) const {
   if (name.empty()) throw AuthInvalidRoleNameException();
   Role* other = _roles.FindByName(name);
   if (other && other->GetId() != exceptId) {
      PELMORA_LOG_ERROR(AuthLog(), "Role with name '%1' already exists", name);
      throw AuthAlreadyExistsException();
   }
}

RoleData AuthorizeManagerImpl::ToRoleData(Role* role) const {
   RoleData data{role->GetId(), role->GetName(), {}};
   _privileges.Names(role->GetPrivileges(), data.privilegeIds);
   return data;
}

void AuthorizeManagerImpl::CreateRole(const std::string& name, const PrivSet& privileges, int& id) {
   WriteGuard guard(&_lock);
   RequireInit();
   CheckRoleName(name, 0);
   PrivSet set = privileges;
   PrivSet known = _privileges.Known();
   for (unsigned i = 0; i < MAX_PRIVILEGES; ++i) {
      if (set.Test(i) && !known.Test(i)) set.Clear(i);
   }
   Ref<Role> role(new Role(_roles.NextFreeId(), name, set));
   Persist([&](AuthTransaction* tx) { _storage->StoreRole(tx, ToRoleData(role.Get())); });
   _roles.Add(role.Get());
   id = role->GetId();
}

void AuthorizeManagerImpl::CreateRoleWithId(const std::string& name, const PrivSet& privileges, int id,
                                            bool persist) {
   WriteGuard guard(&_lock);
   RequireInit();
   if (id <= 0) throw AuthSystemRoleException();
   if (_roles.Find(id)) throw AuthAlreadyExistsException();
   CheckRoleName(name, id);
   Ref<Role> role(new Role(id, name, privileges));
   PrivSet known = _privileges.Known();
   PrivSet set = privileges;
   for (unsigned i = 0; i < MAX_PRIVILEGES; ++i) {
      if (set.Test(i) && !known.Test(i)) set.Clear(i);
   }
   role->SetPrivileges(set);
   if (persist) Persist([&](AuthTransaction* tx) { _storage->StoreRole(tx, ToRoleData(role.Get())); });
   _roles.Add(role.Get());
}

void AuthorizeManagerImpl::ModifyRole(int id, const std::string& name, PrivSet& privileges, bool persist) {
   WriteGuard guard(&_lock);
   RequireInit();
   if (id < 0) throw AuthSystemRoleException();
   Role* role = _roles.Find(id);
   if (!role) throw AuthRoleNotFoundException(id);
   CheckRoleName(name, id);
   PrivSet known = _privileges.Known();
   for (unsigned i = 0; i < MAX_PRIVILEGES; ++i) {
      if (privileges.Test(i) && !known.Test(i)) privileges.Clear(i);
   }
   Ref<Role> changed(new Role(id, name, privileges));
   if (persist) Persist([&](AuthTransaction* tx) { _storage->StoreRole(tx, ToRoleData(changed.Get())); });
   role->SetName(name);
   role->SetPrivileges(privileges);
   AfterChange();
}

void AuthorizeManagerImpl::RemoveRole(int id, bool removePermissions, bool persist) {
   WriteGuard guard(&_lock);
   RequireInit();
   if (id < 0) throw AuthSystemRoleException();
   if (!_roles.Find(id)) throw AuthRoleNotFoundException(id);
   std::vector<ACEData> users;
   ForEachACE([&](const std::string& entityId, ACE* ace) {
      if (ace->GetRole()->GetId() == id) users.push_back(ace->ToData(entityId));
   });
   if (!users.empty() && !removePermissions) throw AuthRolePermissionsExistException();
   if (persist) {
      Persist([&](AuthTransaction* tx) {
         for (const ACEData& data : users) _storage->RemoveACE(tx, data.entityId, data.principal, data.isGroup);
         _storage->RemoveRole(tx, id);
      });
   }
   for (const ACEData& data : users) {
      ACL* acl = FindACL(data.entityId);
      acl->DeleteACE(data.principal, data.isGroup);
      if (acl->IsEmpty()) _acls.erase(data.entityId);
   }
   _roles.Remove(id);
   AfterChange();
}

void AuthorizeManagerImpl::GetRole(int id, Ref<Role>& out) {
   ReadGuard guard(&_lock);
   RequireInit();
   Role* role = _roles.Find(id);
   if (!role) throw AuthRoleNotFoundException(id);
   out = role;
}

void AuthorizeManagerImpl::GetRoles(RoleResult& out) {
   ReadGuard guard(&_lock);
   RequireInit();
   _roles.GetAll(out);
}

void AuthorizeManagerImpl::GetRolePrivList(int id, std::vector<std::string>& privilegeIds) {
   ReadGuard guard(&_lock);
   RequireInit();
   Role* role = _roles.Find(id);
   if (!role) throw AuthRoleNotFoundException(id);
   _privileges.Names(role->GetPrivileges(), privilegeIds);
}

void AuthorizeManagerImpl::GetPrivileges(PrivilegeResult& out) {
   ReadGuard guard(&_lock);
   RequireInit();
   _privileges.GetAll(out);
}

void AuthorizeManagerImpl::GetPrivilege(const std::string& id, Ref<Privilege>& out) {
   ReadGuard guard(&_lock);
   RequireInit();
   Privilege* privilege = _privileges.Find(id);
   if (!privilege) throw AuthPrivilegeNotFoundException(id);
   out = privilege;
}

void AuthorizeManagerImpl::AddPrivileges(const std::vector<PrivilegeDef>& privileges) {
   WriteGuard guard(&_lock);
   RequireInit();
   // Worked on a copy, so that a refused or unstored batch leaves nothing behind.
   PrivilegeTable table = _privileges;
   std::vector<PrivilegeDef> added;
   for (const PrivilegeDef& def : privileges) {
      if (table.Find(def.id) && table.Find(def.id)->GetGroupId() == def.groupId) continue;
      table.Add(def);
      added.push_back(def);
   }
   if (added.empty()) return;
   Persist([&](AuthTransaction* tx) {
      for (const PrivilegeDef& def : added) _storage->StorePrivilege(tx, def);
   });
   _privileges = table;
   // Admin stays the role with every privilege.
   Role* admin = _roles.Find(kRoleAdmin);
   PrivSet all = admin->GetPrivileges();
   for (const PrivilegeDef& def : added) all.Set(_privileges.Find(def.id)->GetIndex());
   admin->SetPrivileges(all);
   AfterChange();
}

void AuthorizeManagerImpl::RemovePrivileges(const std::vector<std::string>& privilegeIds) {
   WriteGuard guard(&_lock);
   RequireInit();
   PrivilegeTable table = _privileges;
   std::vector<unsigned> indexes;
   for (const std::string& id : privilegeIds) {
      Privilege* privilege = table.Find(id);
      if (!privilege) throw AuthPrivilegeNotFoundException(id);
      indexes.push_back(privilege->GetIndex());
      table.Remove(id);
   }
   RoleResult roles;
   _roles.GetAll(roles);
   Persist([&](AuthTransaction* tx) {
      for (const std::string& id : privilegeIds) _storage->RemovePrivilege(tx, id);
      for (const Ref<Role>& role : roles) {
         if (role->IsSystem()) continue;
         RoleData data = ToRoleData(role.Get());
         std::erase_if(data.privilegeIds, [&](const std::string& id) {
            return std::find(privilegeIds.begin(), privilegeIds.end(), id) != privilegeIds.end();
         });
         _storage->StoreRole(tx, data);
      }
   });
   _privileges = table;
   for (unsigned index : indexes) _roles.ClearPrivilege(index);
   AfterChange();
}

void AuthorizeManagerImpl::MoveRolePermissions(int fromRoleId, int toRoleId) {
   WriteGuard guard(&_lock);
   RequireInit();
   if (fromRoleId == toRoleId) throw AuthSameRoleException();
   if (!_roles.Find(fromRoleId)) throw AuthRoleNotFoundException(fromRoleId);
   Role* to = _roles.Find(toRoleId);
   if (!to) throw AuthRoleNotFoundException(toRoleId);
   std::vector<ACEData> moved;
   ForEachACE([&](const std::string& entityId, ACE* ace) {
      if (ace->GetRole()->GetId() == fromRoleId) moved.push_back(ace->ToData(entityId));
   });
   if (fromRoleId == kRoleAdmin && CountRootAdminUsers() > 0) throw AuthMinimumAdminPermissionException();
   Persist([&](AuthTransaction* tx) {
      for (ACEData data : moved) {
         data.roleId = toRoleId;
         _storage->StoreACE(tx, data);
      }
   });
   for (const ACEData& data : moved) FindACL(data.entityId)->ChangeACE(data.principal, data.isGroup, to, data.propagate);
   AfterChange();
}

// ---- permissions --------------------------------------------------------------------

void AuthorizeManagerImpl::CreateACE(AuthEntity* entity, const std::string& principal, bool isGroup, int roleId,
                                     bool propagate) {
   WriteGuard guard(&_lock);
   RequireInit();
   if (!entity) throw AuthEntityNotFoundException(std::string());
   const std::string& entityId = entity->GetId();
   Ref<AuthEntity> found;
   if (!_model->FindEntity(entityId, found)) throw AuthEntityNotFoundException(entityId);
   Role* role = _roles.Find(roleId);
   if (!role) throw AuthRoleNotFoundException(roleId);
   ACL* acl = FindACL(entityId);
   if (acl && acl->FindEntry(principal, isGroup)) throw AuthAlreadyExistsException();
   UserValidationResult validation = CheckPrincipal(principal, isGroup);
   if (validation == USER_NOT_FOUND) throw AuthUserNotFoundException(principal, isGroup);
   Ref<ACE> ace;
   ACE::CreateACE(roleId, principal, isGroup, role, propagate, ace, &validation);
   Persist([&](AuthTransaction* tx) { _storage->StoreACE(tx, ace->ToData(entityId)); });
   GetOrCreateACL(entityId).AddACE(ace.Get());
   AfterChange();
}

void AuthorizeManagerImpl::ModifyACE(AuthEntity* entity, const std::string& principal, bool isGroup, int roleId,
                                     bool propagate) {
   WriteGuard guard(&_lock);
   RequireInit();
   if (!entity) throw AuthEntityNotFoundException(std::string());
   const std::string& entityId = entity->GetId();
   ACL* acl = FindACL(entityId);
   ACE* ace = acl ? acl->FindEntry(principal, isGroup) : nullptr;
   if (!ace) throw AuthPermissionNotFoundException(principal, entityId, isGroup);
   Role* role = _roles.Find(roleId);
   if (!role) throw AuthRoleNotFoundException(roleId);
   if (roleId != kRoleAdmin && IsLastFullAdminUser(entityId, principal, isGroup)) {
      throw AuthMinimumAdminPermissionException();
   }
   ACEData data{entityId, principal, isGroup, roleId, propagate};
   Persist([&](AuthTransaction* tx) { _storage->StoreACE(tx, data); });
   ace->Change(role, propagate);
   AfterChange();
}

void AuthorizeManagerImpl::RemoveACE(AuthEntity* entity, const std::string& principal, bool isGroup) {
   WriteGuard guard(&_lock);
   RequireInit();
   const std::string entityId = entity ? entity->GetId() : std::string();
   ACL* acl = FindACL(entityId);
   if (!acl || !acl->FindEntry(principal, isGroup)) {
      PELMORA_LOG_ERROR(AuthLog(), "Failed to remove permission: not found");
      throw AuthPermissionNotFoundException(principal, entityId, isGroup);
   }
   if (IsLastFullAdminUser(entityId, principal, isGroup)) {
      PELMORA_LOG_ERROR(AuthLog(), "Failed to remove permission: would remove minimum administrator access");
      throw AuthMinimumAdminPermissionException();
   }
   try {
      Persist([&](AuthTransaction* tx) { _storage->RemoveACE(tx, entityId, principal, isGroup); });
   } catch (const AuthStorageException&) {
      PELMORA_LOG_ERROR(AuthLog(), "Failed to remove permission: could not persist to storage");
      throw;
   }
   acl->DeleteACE(principal, isGroup);
   if (acl->IsEmpty()) _acls.erase(entityId);
   AfterChange();
}

void AuthorizeManagerImpl::GetACEs(AuthEntity* entity, bool inherited, ACEResult& out) {
   out.clear();
   ReadGuard guard(&_lock);
   RequireInit();
   if (!entity) throw AuthEntityNotFoundException(std::string());
   const std::string& entityId = entity->GetId();
   if (ACL* acl = FindACL(entityId)) {
      for (const Ref<ACE>& ace : acl->GetEntries()) out.push_back(ace->ToData(entityId));
   }
   if (!inherited || entityId == _rootId) return;
   ParentChain chain;
   _model->GetParentChain(entityId, chain);
   for (const std::string& id : chain) {
      if (ACL* acl = FindACL(id)) {
         for (const Ref<ACE>& ace : acl->GetEntries()) {
            if (ace->GetPropagate()) out.push_back(ace->ToData(id));
         }
      }
   }
}

void AuthorizeManagerImpl::GetACEs(ACEResult& out) {
   out.clear();
   ReadGuard guard(&_lock);
   RequireInit();
   ForEachACE([&](const std::string& entityId, ACE* ace) { out.push_back(ace->ToData(entityId)); });
}

void AuthorizeManagerImpl::GetACEsByRole(int roleId, ACEResult& out) {
   out.clear();
   ReadGuard guard(&_lock);
   RequireInit();
   if (!_roles.Find(roleId)) throw AuthRoleNotFoundException(roleId);
   ForEachACE([&](const std::string& entityId, ACE* ace) {
      if (ace->GetRole()->GetId() == roleId) out.push_back(ace->ToData(entityId));
   });
}

void AuthorizeManagerImpl::ValidateACEs(ACEResult& removed) {
   removed.clear();
   WriteGuard guard(&_lock);
   RequireInit();
   std::vector<ACEData> invalid;
   std::vector<ACEData> all;
   ForEachACE([&](const std::string& entityId, ACE* ace) { all.push_back(ace->ToData(entityId)); });
   for (const ACEData& data : all) {
      Ref<AuthEntity> entity;
      bool known = false;
      try {
         known = _model->FindEntity(data.entityId, entity);
      } catch (const Exception&) {
      }
      if (!known) {
         PELMORA_LOG_WARNING(AuthLog(), "Unknown entity %1 while validating permissions", data.entityId);
         invalid.push_back(data);
         continue;
      }
      UserValidationResult result = CheckPrincipal(data.principal, data.isGroup);
      if (result == USER_UNRESOLVED) {
         // Removing on a directory outage would strip every permission it could not see.
         PELMORA_LOG_ERROR(AuthLog(), "Failed to conclusively determine user %1 while validating permissions, aborting validation",
                           data.principal);
         return;
      }
      if (result == USER_NOT_FOUND) invalid.push_back(data);
   }
   for (const ACEData& data : invalid) {
      if (IsLastFullAdminUser(data.entityId, data.principal, data.isGroup)) continue;
      try {
         Persist([&](AuthTransaction* tx) { _storage->RemoveACE(tx, data.entityId, data.principal, data.isGroup); });
      } catch (const AuthStorageException& e) {
         PELMORA_LOG_ERROR(AuthLog(), "Failed to remove invalid permission %1: %2", Describe(data), e.what());
         continue;
      }
      ACL* acl = FindACL(data.entityId);
      acl->DeleteACE(data.principal, data.isGroup);
      if (acl->IsEmpty()) _acls.erase(data.entityId);
      removed.push_back(data);
   }
   if (!removed.empty()) AfterChange();
}

void AuthorizeManagerImpl::RemoveAssociatedACL(const std::string& entityId) {
   WriteGuard guard(&_lock);
   RequireInit();
   ACL* acl = FindACL(entityId);
   if (!acl) return;
   if (entityId == _rootId && CountRootAdminUsers() > 0) throw AuthMinimumAdminPermissionException();
   std::vector<Ref<ACE>> entries = acl->GetEntries();
   for (const Ref<ACE>& ace : entries) {
      ACEData data = ace->ToData(entityId);
      try {
         Persist([&](AuthTransaction* tx) { _storage->RemoveACE(tx, entityId, data.principal, data.isGroup); });
         acl->DeleteACE(data.principal, data.isGroup);
      } catch (const AuthStorageException&) {
         PELMORA_LOG_ERROR(AuthLog(), "Failed to delete permission %1 from removed entity", Describe(data));
      }
   }
   if (acl->IsEmpty()) _acls.erase(entityId);
   AfterChange();
}

// ---- the process's manager ----------------------------------------------------------

void GetInstance(Ref<AuthorizeManager>& out) {
   // Never destroyed: checks may run on detached threads while the process exits.
   static AuthorizeManager* const instance = [] {
      auto* manager = new AuthorizeManagerImpl();
      manager->IncRef();
      return manager;
   }();
   out = instance;
}

void CreateAuthorizeManager(Ref<AuthorizeManager>& out) { out = new AuthorizeManagerImpl(); }

}  // namespace Pelmora::Authorize
