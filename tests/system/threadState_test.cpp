#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>

#include "pelmora/system.h"
#include "src/system/threadState.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

using Messages = std::list<std::string>;

Messages Copy(const ThreadState* state) {
   Messages messages;
   EXPECT_TRUE(state->CopyState(messages, 1));
   return messages;
}

TEST(ThreadStateTest, MessagesTakeTheLowestFreeCellAndCopyOldestFirst) {
   Ref<ThreadStateImpl> state = new ThreadStateImpl(1);
   const char* texts[] = {"first", "second", "third"};
   for (unsigned i = 0; i < 3; ++i) EXPECT_EQ(i, state->Add(texts[i]));
   state->Remove(0);
   EXPECT_EQ(0u, state->Add("fourth"));  // a lower cell, but the newest message
   EXPECT_EQ((Messages{"second", "third", "fourth"}), Copy(state.Get()));
   for (unsigned index : {1, 2, 0}) state->Remove(index);
   EXPECT_EQ(Messages{}, Copy(state.Get()));
   EXPECT_EQ(0u, state->Add(std::string(300, 'x').c_str()));
   EXPECT_EQ((Messages{std::string(255, 'x')}), Copy(state.Get()));
}

TEST(ThreadStateTest, TheSeventeenthMessageOnlyCountsAsOverflow) {
   Ref<ThreadStateImpl> state = new ThreadStateImpl(1);
   for (unsigned i = 0; i < 16; ++i) EXPECT_EQ(i, state->Add(std::to_string(i).c_str()));
   EXPECT_EQ(16u, state->Add("seventeenth"));
   EXPECT_EQ(16u, state->Add("eighteenth"));
   EXPECT_EQ(2u, state->GetOverflow());
   EXPECT_EQ(16u, Copy(state.Get()).size());
   state->Remove(16);
   EXPECT_EQ(1u, state->GetOverflow());
   state->Remove(5);
   EXPECT_EQ(5u, state->Add("again"));
   EXPECT_EQ("again", Copy(state.Get()).back());
}

// A reader racing the owner: every copy it accepts shows a state the owner really had,
// never a text half replaced; some copies give up when every attempt was torn.
TEST(ThreadStateTest, ConcurrentCopiesAreNeverTorn) {
   Ref<ThreadStateImpl> state = new ThreadStateImpl(1);
   std::atomic<bool> stop{false};
   std::atomic<int> rounds{0};
   std::thread owner([&] {
      for (int round = 0; !stop; ++round) {
         std::string text(200, static_cast<char>('a' + round % 26));
         unsigned first = state->Add(text.c_str());
         unsigned second = state->Add(text.c_str());
         state->Remove(first);
         state->Remove(second);
         rounds.store(round, std::memory_order_relaxed);
      }
   });
   {
      Pelmora::Testing::Watchdog watchdog("the owner's first round");
      while (rounds.load() == 0) std::this_thread::yield();
   }
   int accepted = 0;
   for (int copies = 0; copies < 200000 && (copies < 2000 || rounds.load() < 20000); ++copies) {
      Messages messages;
      if (!state->CopyState(messages, 3)) continue;
      ++accepted;
      ASSERT_LE(messages.size(), 2u);
      for (const std::string& text : messages) ASSERT_EQ(std::string(200, text[0]), text);
      ASSERT_TRUE(messages.size() < 2 || messages.front() == messages.back());
   }
   stop = true;
   Pelmora::Testing::Join(owner, "owner to finish");
   EXPECT_GT(accepted, 0);
}

TEST(ThreadStateDeathTest, IndexMisusePanics) {
   Ref<ThreadStateImpl> state = new ThreadStateImpl(1);
   const std::string where = "\" @ src/system/threadState.cpp:[0-9]+\n";
   EXPECT_DEATH(state->Remove(17),
                "Assert Failed: \"index <= THREAD_STATE_MAXIMUM_MESSAGES" + where);
   EXPECT_DEATH(state->Remove(16), "Assert Failed: \"_overflow" + where);
   EXPECT_DEATH(
       state->Remove(3),
       "\"index == THREAD_STATE_MAXIMUM_MESSAGES \\|\\| _memory\\[index\\].order != 0" + where);
   unsigned index = state->Add("once");
   state->Remove(index);
   EXPECT_DEATH(state->Remove(index), "_memory\\[index\\].order != 0" + where);
}

TEST(ThreadStateRegistryTest, CopiesEveryLivingThreadByItsId) {
   std::atomic<bool> posted{false}, release{false};
   long long workerId = 0;
   std::thread worker([&] {
      workerId = GetThreadId();
      AddThreadState("worker busy");
      unsigned gone = AddThreadState("short-lived");
      RemoveThreadState(gone);
      posted = true;
      while (!release) std::this_thread::yield();
   });
   {
      Pelmora::Testing::Watchdog watchdog("the worker to post its states");
      while (!posted) std::this_thread::yield();
   }
   unsigned mine = AddThreadState("main waiting");
   std::map<long long, Messages> states;
   states[GetThreadId()] = {"kept"};
   CopyThreadStates(states, 3);
   EXPECT_EQ((Messages{"worker busy"}), states[workerId]);
   EXPECT_EQ((Messages{"kept", "main waiting"}), states[GetThreadId()]);

   std::map<long long, Messages> unread;
   CopyThreadStates(unread, 0);
   EXPECT_EQ((Messages{THREAD_STATE_READFAILED_TOKEN}), unread[workerId]);
   EXPECT_STREQ("Failed to read thread state", THREAD_STATE_READFAILED_TOKEN);

   release = true;
   Pelmora::Testing::Join(worker, "worker to finish");
   states.clear();
   CopyThreadStates(states, 3);
   EXPECT_EQ(0u, states.count(workerId));  // its board went with it
   RemoveThreadState(mine);
}

}  // namespace
}  // namespace Pelmora::System
