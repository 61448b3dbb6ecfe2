#pragma once
// Channels and alerts. A channel is a name through which parts of one process hand each
// other messages (any Object): every reader of the name gets each message a writer of that
// name sends, on the sender's thread, in reading order. Alerts are notable events an
// operator should hear of; the application's alerts are written to its log under the
// subsystem "alerts". All thread-safe.

#include <functional>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Service {

class ChannelReader;

using ChannelCallback = std::function<void(ChannelReader* reader, Object* message)>;

// Receives until it or its manager is closed.
class PELMORA_EXPORT ChannelReader : public virtual Object {
public:
   virtual const std::string& GetName() const = 0;
   virtual void Close() = 0;
};

class PELMORA_EXPORT ChannelWriter : public virtual Object {
public:
   virtual const std::string& GetName() const = 0;
   // Hands `message` to every open reader of the channel; returns how many took it.
   virtual int Write(Object* message) = 0;
};

class PELMORA_EXPORT ChannelManager : public virtual Object {
public:
   virtual void CreateChannelReader(const std::string& name, const ChannelCallback& callback,
                                    Ref<ChannelReader>& out) = 0;
   virtual void CreateChannelWriter(const std::string& name, Ref<ChannelWriter>& out) = 0;
   // Closes every reader; writers then reach nobody.
   virtual void Close() = 0;
};
PELMORA_EXPORT void CreateChannelManager(Ref<ChannelManager>& out);

class PELMORA_EXPORT Alerts : public virtual Object {
public:
   enum Severity { ALERT_INFO, ALERT_WARNING, ALERT_CRITICAL };
   // Reports `text` under `name`; repeats of one name and text are counted, not dropped.
   virtual void Raise(const std::string& name, Severity severity, const std::string& text) = 0;
   virtual long long GetRaisedCount(const std::string& name) = 0;
};
// Alerts written to the default log manager's "alerts" logger.
PELMORA_EXPORT void CreateLogAlerts(Ref<Alerts>& out);
// The application's alerts (made by Init); null before.
PELMORA_EXPORT Alerts* GetAlerts();

}  // namespace Pelmora::Service
