#include <gtest/gtest.h>

#include <algorithm>

#include "pelmora/authorize/entityTree.h"
#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/exceptions.h"

namespace Pelmora::Authorize {
namespace {

class EntityTreeTest : public ::testing::Test {
protected:
   void SetUp() override {
      CreateEntityTree("root", tree);
      tree->AddEntity("a", "root");
      tree->AddEntity("b", "a");
      tree->AddEntity("c", "b");
      tree->AddEntity("x", "root");
   }
   ParentChain Chain(const std::string& id) {
      ParentChain chain;
      tree->GetParentChain(id, chain);
      return chain;
   }
   Ref<EntityTree> tree;
};

TEST_F(EntityTreeTest, ChainsRunFromTheParentToTheRoot) {
   EXPECT_EQ((ParentChain{"b", "a", "root"}), Chain("c"));
   EXPECT_TRUE(Chain("root").empty());
   EXPECT_THROW(Chain("zz"), AuthEntityNotFoundException);
   EXPECT_THROW(tree->AddEntity("a", "root"), AuthAlreadyExistsException);
   EXPECT_THROW(tree->AddEntity("n", "zz"), AuthEntityNotFoundException);
   Ref<AuthEntity> root;
   tree->GetRootEntity(root);
   EXPECT_EQ("root", root->GetId());
}

TEST_F(EntityTreeTest, MovesCarryTheSubtreeAndNeverMakeACycle) {
   tree->MoveEntity("b", "x");
   EXPECT_EQ((ParentChain{"b", "x", "root"}), Chain("c"));
   EXPECT_THROW(tree->MoveEntity("x", "c"), InvalidArgumentException);
   EXPECT_THROW(tree->MoveEntity("b", "b"), InvalidArgumentException);
   EXPECT_THROW(tree->MoveEntity("root", "a"), InvalidArgumentException);
   EXPECT_EQ((ParentChain{"b", "x", "root"}), Chain("c"));
}

TEST_F(EntityTreeTest, RemovingTakesTheSubtreeButNeverTheRoot) {
   std::vector<std::string> removed;
   tree->RemoveEntity("a", removed);
   std::sort(removed.begin(), removed.end());
   EXPECT_EQ((std::vector<std::string>{"a", "b", "c"}), removed);
   EXPECT_EQ(2u, tree->GetEntityCount());
   Ref<AuthEntity> entity;
   EXPECT_FALSE(tree->FindEntity("c", entity));
   EXPECT_THROW(tree->RemoveEntity("root", removed), InvalidArgumentException);
   tree->AddEntity("a", "x");
   EXPECT_EQ((ParentChain{"x", "root"}), Chain("a"));
}

}  // namespace
}  // namespace Pelmora::Authorize
