// Authorisation checks on a 10,000-entity tree 20 levels deep for a user who holds 10
// roles through 10 groups: a cached check, an uncached one (the walk up from a deep
// entity), and a list of 1,000 checks under one lock. The peer is the same question as
// a std::unordered_map lookup of the entity plus a std::bitset test.

#include <bitset>
#include <random>
#include <string>
#include <unordered_map>
#include <vector>

#include "pelmora/pelmora.h"
#include "support/ratioMain.h"
#include "tests/support/authProviders.h"

using namespace Pelmora;
using namespace Pelmora::Authorize;

namespace {

constexpr int kChains = 500;
constexpr int kDepth = 20;
constexpr int kRoles = 10;

struct World {
   Ref<EntityTree> tree;
   Ref<TestSupport::FakeDirectory> directory;
   Ref<TestSupport::MemoryStorage> storage;
   Ref<AuthorizeManager> manager;
   Ref<Session> session;
   std::vector<Ref<AuthEntity>> entities;  // every entity but the root
   std::vector<Ref<AuthEntity>> deep;      // the deepest of each chain
   std::string privilege;
   // The peer: the user's effective set per entity id.
   std::unordered_map<std::string, std::bitset<MAX_PRIVILEGES>> peer;
   unsigned privilegeIndex = 0;

   World() {
      CreateEntityTree("root", tree);
      for (int c = 0; c < kChains; ++c) {
         std::string parent = "root";
         for (int d = 0; d < kDepth; ++d) {
            std::string id = "e" + std::to_string(c) + "." + std::to_string(d);
            tree->AddEntity(id, parent);
            parent = id;
         }
      }
      directory = new TestSupport::FakeDirectory();
      directory->AddUser("root");
      directory->AddUser("alice");
      storage = new TestSupport::MemoryStorage();
      CreateAuthorizeManager(manager);
      Ref<Service::Logger> quiet;
      Service::CreateLogger(nullptr, "authorize", "error", nullptr, quiet);
      manager->Init(directory.Get(), storage.Get(), tree.Get(), quiet.Get());
      std::vector<PrivilegeDef> defs;
      for (int p = 0; p < 100; ++p) defs.push_back({"App.P" + std::to_string(p), "App"});
      manager->AddPrivileges(defs);
      // Ten roles of ten privileges each, granted through ten groups at different depths.
      for (int r = 0; r < kRoles; ++r) {
         PrivSet set;
         for (int p = 0; p < 10; ++p) {
            Ref<Privilege> privilege;
            manager->GetPrivilege("App.P" + std::to_string(r * 10 + p), privilege);
            set.Set(privilege->GetIndex());
         }
         int id = 0;
         manager->CreateRole("role" + std::to_string(r), set, id);
         std::string group = "group" + std::to_string(r);
         directory->AddMember(group, "alice");
         Ref<AuthEntity> at;
         if (r == 0) {
            tree->GetRootEntity(at);
         } else {
            tree->FindEntity("e" + std::to_string(r) + "." + std::to_string(r), at);
         }
         manager->CreateACE(at.Get(), group, true, id, true);
      }
      privilege = "App.P5";
      Ref<Privilege> p5;
      manager->GetPrivilege(privilege, p5);
      privilegeIndex = p5->GetIndex();
      session = new TestSupport::TestSession();
      manager->AddConnection(session.Get(), "alice", nullptr, false);
      for (int c = 0; c < kChains; ++c) {
         for (int d = 0; d < kDepth; ++d) {
            Ref<AuthEntity> entity;
            tree->FindEntity("e" + std::to_string(c) + "." + std::to_string(d), entity);
            entities.push_back(entity);
            std::bitset<MAX_PRIVILEGES> bits;
            bits.set(privilegeIndex);
            peer.emplace(entity->GetId(), bits);
         }
         deep.push_back(entities.back());
      }
   }
};

World& TheWorld() {
   static World* world = new World();
   return *world;
}

// A fixed random order of entities, so the caches and the peer see the same walk.
std::vector<AuthEntity*> Order(const std::vector<Ref<AuthEntity>>& from, size_t count) {
   std::mt19937 random(7);
   std::vector<AuthEntity*> order;
   for (size_t i = 0; i < count; ++i) order.push_back(from[random() % from.size()].Get());
   return order;
}

void BM_OursCachedCheck(benchmark::State& state) {
   World& w = TheWorld();
   w.manager->UpdateMaxUserCacheEntries(20000);
   std::vector<AuthEntity*> order = Order(w.entities, 4096);
   for (AuthEntity* entity : order) w.manager->HasEntityPrivilege(w.session.Get(), entity, w.privilege);
   size_t i = 0;
   for (auto _ : state) {
      benchmark::DoNotOptimize(w.manager->HasEntityPrivilege(w.session.Get(), order[i++ & 4095], w.privilege));
   }
}

void BM_PeerCheck(benchmark::State& state) {
   World& w = TheWorld();
   std::vector<AuthEntity*> order = Order(w.entities, 4096);
   size_t i = 0;
   for (auto _ : state) {
      auto it = w.peer.find(order[i++ & 4095]->GetId());
      benchmark::DoNotOptimize(it != w.peer.end() && it->second.test(w.privilegeIndex));
   }
}

void BM_OursUncachedDeepCheck(benchmark::State& state) {
   World& w = TheWorld();
   // No cache: every check is a first check and walks up from the deepest level.
   w.manager->UpdateMaxUserCacheEntries(0);
   std::vector<AuthEntity*> order = Order(w.deep, 4096);
   size_t i = 0;
   for (auto _ : state) {
      benchmark::DoNotOptimize(w.manager->HasEntityPrivilege(w.session.Get(), order[i++ & 4095], w.privilege));
   }
   w.manager->UpdateMaxUserCacheEntries(20000);
}

void BM_OursCachedList1000(benchmark::State& state) {
   World& w = TheWorld();
   w.manager->UpdateMaxUserCacheEntries(20000);
   EntityPrivilegeList list;
   for (AuthEntity* entity : Order(w.entities, 1000)) list.emplace_back(entity, w.privilege);
   std::vector<bool> results;
   w.manager->HasEntityPrivilegeList(w.session.Get(), list, results);
   for (auto _ : state) {
      w.manager->HasEntityPrivilegeList(w.session.Get(), list, results);
      benchmark::DoNotOptimize(results);
   }
}

void BM_PeerList1000(benchmark::State& state) {
   World& w = TheWorld();
   std::vector<AuthEntity*> order = Order(w.entities, 1000);
   std::vector<bool> results(order.size());
   for (auto _ : state) {
      for (size_t i = 0; i < order.size(); ++i) {
         auto it = w.peer.find(order[i]->GetId());
         results[i] = it != w.peer.end() && it->second.test(w.privilegeIndex);
      }
      benchmark::DoNotOptimize(results);
   }
}

}  // namespace

BENCHMARK(BM_OursCachedCheck);
BENCHMARK(BM_PeerCheck);
BENCHMARK(BM_OursUncachedDeepCheck);
BENCHMARK(BM_OursCachedList1000)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_PeerList1000)->Unit(benchmark::kMicrosecond);

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(argc, argv,
                                      {{"BM_OursCachedCheck", "BM_PeerCheck"},
                                       {"BM_OursUncachedDeepCheck", "BM_PeerCheck"},
                                       {"BM_OursCachedList1000", "BM_PeerList1000"}});
}
