#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "pelmora/object.h"
#include "tests/support/watchdog.h"

namespace Pelmora {
namespace {

class Session : public WeakLinkableImpl<> {
public:
   explicit Session(std::atomic<int>* destroyed = nullptr) : _destroyed(destroyed) {}
   ~Session() override {
      if (_destroyed) ++*_destroyed;
   }

private:
   std::atomic<int>* _destroyed;
};

class Plain : public ObjectImpl {};

TEST(WeakRefTest, PromotesWhileAliveAndNotAfterTheLastDecRef) {
   std::atomic<int> destroyed{0};
   Ref<Session> session = new Session(&destroyed);
   WeakRef<Session> weak = session;
   EXPECT_EQ(1, session->GetRefCount());  // a weak reference does not count

   Ref<Session> promoted = weak.Promote();
   EXPECT_EQ(session.Get(), promoted.Get());
   EXPECT_EQ(2, session->GetRefCount());
   EXPECT_FALSE(weak.IsDetached());

   promoted.Reset();
   session.Reset();
   EXPECT_EQ(1, destroyed);
   EXPECT_TRUE(weak.IsDetached());
   EXPECT_TRUE(weak.Promote().IsNull());

   Ref<Object> out = new Plain();
   EXPECT_FALSE(weak.GetLink()->Promote(out));
   EXPECT_TRUE(out.IsNull());  // a failed promotion empties the target
}

TEST(WeakRefTest, TheLinkOutlivesTheObjectAndIdentifiesIt) {
   Ref<Session> session = new Session();
   Ref<WeakLink> link;
   session->AttachWeakRef(link);
   EXPECT_TRUE(session->HasLink(link.Get()));
   EXPECT_FALSE(session->HasLink(nullptr));  // it has a link, so null is not it

   Ref<Session> other = new Session();
   EXPECT_FALSE(other->HasLink(link.Get()));
   EXPECT_EQ(2, link->GetRefCount());  // the object's own and ours

   session.Reset();
   EXPECT_EQ(1, link->GetRefCount());
   EXPECT_TRUE(link->IsDetached());
}

TEST(WeakLinkableImplPrivateTest, WithoutALinkOnlyNullIsItsLink) {
   WeakLinkableImplPrivate* holder = new WeakLinkableImplPrivate();
   EXPECT_TRUE(holder->HasLink(nullptr));
   Ref<Session> session = new Session();
   Ref<WeakLink> link;
   session->AttachWeakRef(link);
   EXPECT_FALSE(holder->HasLink(link.Get()));
   Plain owner;
   holder->Init(&owner);  // the destructor needs a link
   delete holder;
}

TEST(WeakRefTest, PromoteRacingTheLastDecRefNeverResurrects) {
   // Each round: one thread drops the last strong reference while others promote.
   // A promotion either wins a live object or finds it gone; the object dies once.
   constexpr int kRounds = 300;
   std::atomic<int> destroyed{0};
   std::atomic<int> promotions{0};
   for (int round = 0; round < kRounds; ++round) {
      Ref<Session> session = new Session(&destroyed);
      WeakRef<Session> weak = session;
      std::atomic<bool> go{false};
      std::vector<std::thread> promoters;
      for (int t = 0; t < 3; ++t) {
         promoters.emplace_back([&] {
            while (!go.load()) std::this_thread::yield();
            for (int i = 0; i < 4; ++i) {
               if (Ref<Session> live = weak.Promote()) {
                  EXPECT_GT(live->GetRefCount(), 0);
                  ++promotions;
               }
            }
         });
      }
      go = true;
      session.Reset();
      Pelmora::Testing::JoinAll(promoters, "promoters to finish");
      EXPECT_TRUE(weak.IsDetached());
      EXPECT_EQ(round + 1, destroyed.load());
   }
   EXPECT_EQ(kRounds, destroyed.load());
}

}  // namespace
}  // namespace Pelmora
