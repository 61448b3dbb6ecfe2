// Channels deliver to every open reader of their name; alerts are counted and logged.

#include <gtest/gtest.h>

#include <vector>

#include "pelmora/service.h"

namespace Pelmora::Service {
namespace {

class Message : public ObjectImpl {
public:
   explicit Message(int value) : value(value) {}
   int value;
};

TEST(ChannelTest, WritersReachEveryOpenReaderOfTheirNameOnly) {
   Ref<ChannelManager> manager;
   CreateChannelManager(manager);
   std::vector<std::string> got;
   auto record = [&](const std::string& who) {
      return [&got, who](ChannelReader* reader, Object* message) {
         got.push_back(who + "@" + reader->GetName() + "=" +
                       std::to_string(dynamic_cast<Message*>(message)->value));
      };
   };
   Ref<ChannelReader> a, b, other;
   manager->CreateChannelReader("events", record("a"), a);
   manager->CreateChannelReader("events", record("b"), b);
   manager->CreateChannelReader("other", record("o"), other);
   Ref<ChannelWriter> writer;
   manager->CreateChannelWriter("events", writer);
   Ref<Message> one = new Message(1), two = new Message(2);
   EXPECT_EQ(writer->Write(one.Get()), 2);
   a->Close();
   a->Close();
   EXPECT_EQ(writer->Write(two.Get()), 1);
   EXPECT_EQ(got, (std::vector<std::string>{"a@events=1", "b@events=1", "b@events=2"}));
   manager->Close();
   EXPECT_EQ(writer->Write(one.Get()), 0);
   Ref<ChannelReader> late;
   manager->CreateChannelReader("events", record("late"), late);
   EXPECT_EQ(writer->Write(one.Get()), 0);
}

TEST(ChannelTest, AReaderMayCloseItselfFromItsCallback) {
   Ref<ChannelManager> manager;
   CreateChannelManager(manager);
   int calls = 0;
   Ref<ChannelReader> reader;
   manager->CreateChannelReader(
       "once", [&](ChannelReader* self, Object*) { ++calls, self->Close(); }, reader);
   reader.Reset();  // the manager keeps it open
   Ref<ChannelWriter> writer;
   manager->CreateChannelWriter("once", writer);
   Ref<Message> message = new Message(0);
   EXPECT_EQ(writer->Write(message.Get()), 1);
   EXPECT_EQ(writer->Write(message.Get()), 0);
   EXPECT_EQ(calls, 1);
}

TEST(AlertsTest, RaisedAlertsAreCountedPerName) {
   Ref<Alerts> alerts;
   CreateLogAlerts(alerts);
   alerts->Raise("disk", Alerts::ALERT_WARNING, "almost full");
   alerts->Raise("disk", Alerts::ALERT_CRITICAL, "full");
   alerts->Raise("fan", Alerts::ALERT_INFO, "slow");
   EXPECT_EQ(alerts->GetRaisedCount("disk"), 2);
   EXPECT_EQ(alerts->GetRaisedCount("fan"), 1);
   EXPECT_EQ(alerts->GetRaisedCount("none"), 0);
}

}  // namespace
}  // namespace Pelmora::Service
