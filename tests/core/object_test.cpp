#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "pelmora/exception.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/object.h"
#include "tests/support/watchdog.h"

namespace Pelmora {

// In namespace Pelmora so that its mangled name is N7Pelmora3FooE.
class Foo : public ObjectImpl {
public:
   explicit Foo(int* destroyed = nullptr) : _destroyed(destroyed) {}
   ~Foo() override {
      if (_destroyed) ++*_destroyed;
   }

private:
   int* _destroyed;
};

namespace {

class Bar : public Foo {};

class RefusesFirstReference : public ObjectImpl {
public:
   explicit RefusesFirstReference(bool* destroyed) : _destroyed(destroyed) {}
   ~RefusesFirstReference() override { *_destroyed = true; }

protected:
   void FirstIncRef(const std::type_info&) override { throw InvalidStateException(); }

private:
   bool* _destroyed;
};

// Overrides the operations in the form the interfaces document: ToString and the hooks
// are not const.
class DescribesItself : public ObjectImpl {
public:
   DescribesItself(int* firsts, int* finals) : _firsts(firsts), _finals(finals) {}
   std::string ToString() override { return "itself"; }

protected:
   void FirstIncRef(const std::type_info& type) override {
      ++*_firsts;
      ObjectImpl::FirstIncRef(type);
   }
   void FinalDecRef(const std::type_info& type) override {
      ++*_finals;
      ObjectImpl::FinalDecRef(type);
   }

private:
   int* _firsts;
   int* _finals;
};

TEST(RefTest, OverridesOfTheDocumentedFormsAreTheOnesCalled) {
   int firsts = 0, finals = 0;
   {
      Ref<DescribesItself> object = new DescribesItself(&firsts, &finals);
      Ref<Object> other = object;
      EXPECT_EQ("itself", other->ToString());
      const Object* constant = object.Get();
      EXPECT_EQ("<itself>", MessageFormatter::ASPrint("<%1>", constant));
      EXPECT_EQ(1, firsts);
      EXPECT_EQ(0, finals);
   }
   EXPECT_EQ(1, finals);
}

TEST(RefTest, CountsReferencesAndDestroysOnTheLastOne) {
   int destroyed = 0;
   Foo* raw = new Foo(&destroyed);
   {
      Ref<Foo> a = raw;
      EXPECT_EQ(1, raw->GetRefCount());
      Ref<Foo> b = a;
      Ref<Object> c = b;  // conversion along the class tree
      EXPECT_EQ(3, raw->GetRefCount());
      b = b;  // self-assignment keeps the object
      a = a.Get();
      EXPECT_EQ(3, raw->GetRefCount());
      Ref<Foo> moved = std::move(b);
      EXPECT_EQ(nullptr, b.Get());
      EXPECT_EQ(3, raw->GetRefCount());
      raw->IncRef();
      EXPECT_EQ(4, raw->DecRef());  // DecRef answers the count before it
   }
   EXPECT_EQ(1, destroyed);
}

TEST(RefTest, AssignmentReferencesTheNewTargetBeforeReleasingTheOld) {
   // The old target keeps the new one alive: releasing the old first would free the new.
   struct Holder : ObjectImpl {
      Ref<Object> next;
   };
   int destroyed = 0;
   Ref<Holder> head = new Holder();
   head->next = new Foo(&destroyed);
   Ref<Object> cursor = head;
   cursor = head->next;  // the holder dies here only after `next` is referenced
   head.Reset();
   EXPECT_EQ(0, destroyed);
   EXPECT_EQ(1, cursor->GetRefCount());
   cursor.Reset();
   EXPECT_EQ(1, destroyed);
}

TEST(RefTest, CheckedCastThrowsTypeMismatchForTheWrongTypeAndPassesNull) {
   Ref<Object> bar = new Bar();
   EXPECT_EQ(bar.Get(), static_cast<Object*>(bar.Cast<Foo>().Get()));
   EXPECT_TRUE(Ref<Object>().Cast<Bar>().IsNull());

   Ref<Object> foo = new Foo();
   try {
      foo.Cast<Bar>();
      FAIL() << "no exception";
   } catch (const TypeMismatchException& e) {
      std::string expected = std::string("Type Mismatch: expected: ") + typeid(Bar).name() +
                             ", found: N7Pelmora3FooE";
      EXPECT_EQ(expected, e.what());
   }
   EXPECT_EQ(1, foo->GetRefCount());
}

TEST(RefTest, FailingFirstReferenceDestroysTheObjectAndLeavesTheRefEmpty) {
   bool destroyed = false;
   Ref<RefusesFirstReference> ref;
   EXPECT_THROW(ref = new RefusesFirstReference(&destroyed), InvalidStateException);
   EXPECT_TRUE(destroyed);
   EXPECT_TRUE(ref.IsNull());
}

TEST(RefTest, ContainersHoldReferences) {
   int destroyed = 0;
   {
      RefVector<Foo> vector{new Foo(&destroyed), new Foo(&destroyed)};
      RefMap<int, Foo> map;
      map[1] = vector[0];
      RefHashMap<std::string, Foo> hashMap{{"a", vector[1]}};
      RefSet<Foo> set(vector.begin(), vector.end());
      EXPECT_EQ(3, vector[0]->GetRefCount());
      vector.clear();
      EXPECT_EQ(0, destroyed);
      EXPECT_EQ(2, set.size());
   }
   EXPECT_EQ(2, destroyed);
}

TEST(RefTest, CopiesAcrossThreadsKeepTheCountExact) {
   int destroyed = 0;
   Ref<Foo> shared = new Foo(&destroyed);
   std::vector<std::thread> threads;
   for (int t = 0; t < 4; ++t) {
      threads.emplace_back([shared] {
         for (int i = 0; i < 20000; ++i) {
            Ref<Foo> copy = shared;
            Ref<Object> other = copy;
         }
      });
   }
   Pelmora::Testing::JoinAll(threads, "threads to finish");
   EXPECT_EQ(1, shared->GetRefCount());
   shared.Reset();
   EXPECT_EQ(1, destroyed);
}

TEST(ObjectTest, ToStringNamesTheMangledTypeAndAddress) {
   Ref<Foo> foo = new Foo();
   char address[32];
   snprintf(address, sizeof(address), "%p", static_cast<void*>(foo.Get()));
   EXPECT_EQ(std::string("[N7Pelmora3FooE:") + address + "]", foo->ToString());
}

TEST(ObjectDeathTest, DestroyingAReferencedObjectPanics) {
   EXPECT_DEATH(
      {
         Foo foo;
         foo.IncRef();
      },
      "Panic: Assert Failed: \"0 == _refCount\" @ src/core/object.cpp:[0-9]+\n");
}

TEST(ScoreboardTest, CountsLiveReferencedInstancesPerClass) {
   Ref<Foo> keep = new Foo();
   std::vector<Ref<Bar>> bars{new Bar(), new Bar(), new Bar()};
   bars.pop_back();
   ASSERT_NE(nullptr, GetScoreboard());
   std::string scores;
   ObjectImpl::GetScores(scores);
   EXPECT_NE(std::string::npos, scores.find(std::string("=> ") + TypeName(typeid(Bar)) + " - 2\n"))
      << scores;
   EXPECT_NE(std::string::npos, scores.find("=> N7Pelmora3FooE - 1\n")) << scores;
}

TEST(RefTrackerTest, RecordsWhereTrackedObjectsWereFirstReferenced) {
   Ref<RefTracker> tracker;
   CreateRefTracker({TypeName(typeid(Bar))}, tracker);
   std::vector<Ref<Foo>> objects;
   for (int i = 0; i < 2; ++i) objects.push_back(new Bar());  // one site, two objects
   Ref<Bar> other = new Bar();
   objects.push_back(new Foo());  // not tracked

   std::string scores;
   tracker->GetScores(scores);
   std::string name = TypeName(typeid(Bar));
   size_t two = scores.find("Trace (" + name + ", count:2):\n");
   size_t one = scores.find("Trace (" + name + ", count:1):\n");
   ASSERT_NE(std::string::npos, two) << scores;
   ASSERT_NE(std::string::npos, one) << scores;
   EXPECT_LT(two, one);  // highest count first
   EXPECT_EQ(std::string::npos, scores.find("N7Pelmora3FooE"));

   objects.clear();
   other.Reset();
   scores.clear();
   tracker->GetScores(scores);
   EXPECT_EQ("\n", scores);
}

}  // namespace
}  // namespace Pelmora
