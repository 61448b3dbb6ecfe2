// In-process channels and the alerts written to the log.

#include <map>
#include <memory>
#include <mutex>
#include <vector>

#include "pelmora/service/logMacros.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

namespace {

class ChannelReaderImpl;

// What readers and writers share with their manager; outlives a closed manager.
struct ChannelTable {
   std::mutex mutex;
   bool closed = false;
   std::map<std::string, RefVector<ChannelReaderImpl>> readers;
};

class ChannelReaderImpl : public virtual ChannelReader, public ObjectImpl {
public:
   ChannelReaderImpl(std::string name, ChannelCallback callback, std::weak_ptr<ChannelTable> table)
      : _name(std::move(name)), _callback(std::move(callback)), _table(std::move(table)) {}
   const std::string& GetName() const override { return _name; }
   void Close() override {
      Ref<ChannelReaderImpl> self(this);  // the table's reference may be the last
      std::shared_ptr<ChannelTable> table = _table.lock();
      if (!table) return;
      std::lock_guard<std::mutex> lock(table->mutex);
      auto it = table->readers.find(_name);
      if (it == table->readers.end()) return;
      std::erase_if(it->second, [this](const Ref<ChannelReaderImpl>& r) { return r.Get() == this; });
      if (it->second.empty()) table->readers.erase(it);
   }
   void Deliver(Object* message) { _callback(this, message); }

private:
   std::string _name;
   ChannelCallback _callback;
   std::weak_ptr<ChannelTable> _table;
};

class ChannelWriterImpl : public virtual ChannelWriter, public ObjectImpl {
public:
   ChannelWriterImpl(std::string name, std::weak_ptr<ChannelTable> table)
      : _name(std::move(name)), _table(std::move(table)) {}
   const std::string& GetName() const override { return _name; }
   int Write(Object* message) override {
      std::shared_ptr<ChannelTable> table = _table.lock();
      if (!table) return 0;
      RefVector<ChannelReaderImpl> readers;
      {
         std::lock_guard<std::mutex> lock(table->mutex);
         auto it = table->readers.find(_name);
         if (it != table->readers.end()) readers = it->second;
      }
      // Outside the lock: a callback may read or write channels itself.
      for (auto& reader : readers) reader->Deliver(message);
      return static_cast<int>(readers.size());
   }

private:
   std::string _name;
   std::weak_ptr<ChannelTable> _table;
};

class ChannelManagerImpl : public virtual ChannelManager, public ObjectImpl {
public:
   void CreateChannelReader(const std::string& name, const ChannelCallback& callback,
                            Ref<ChannelReader>& out) override {
      Ref<ChannelReaderImpl> reader = new ChannelReaderImpl(name, callback, _table);
      std::lock_guard<std::mutex> lock(_table->mutex);
      if (!_table->closed) _table->readers[name].push_back(reader);
      out = reader.Get();
   }
   void CreateChannelWriter(const std::string& name, Ref<ChannelWriter>& out) override {
      out = new ChannelWriterImpl(name, _table);
   }
   void Close() override {
      std::map<std::string, RefVector<ChannelReaderImpl>> readers;  // released unlocked
      std::lock_guard<std::mutex> lock(_table->mutex);
      _table->closed = true;
      readers.swap(_table->readers);
   }
   ~ChannelManagerImpl() override { Close(); }

private:
   std::shared_ptr<ChannelTable> _table = std::make_shared<ChannelTable>();
};

class LogAlertsImpl : public virtual Alerts, public ObjectImpl {
public:
   LogAlertsImpl() { GetDefaultLogger()->CreateLogger("alerts", _logger); }
   void Raise(const std::string& name, Severity severity, const std::string& text) override {
      long long count;
      {
         std::lock_guard<std::mutex> lock(_mutex);
         count = ++_counts[name];
      }
      static const char* const kNames[] = {"info", "warning", "critical"};
      const Logger::LogLevel kLevels[] = {Logger::LOG_INFO, Logger::LOG_WARNING, Logger::LOG_ERROR};
      if (_logger->IsLevelWanted(kLevels[severity])) {
         LogInternal(_logger.Get(), kLevels[severity], "Alert %1 (%2, #%3): %4", name,
                     kNames[severity], count, text);
      }
   }
   long long GetRaisedCount(const std::string& name) override {
      std::lock_guard<std::mutex> lock(_mutex);
      auto it = _counts.find(name);
      return it == _counts.end() ? 0 : it->second;
   }

private:
   Ref<Logger> _logger;
   std::mutex _mutex;
   std::map<std::string, long long> _counts;
};

std::mutex g_alertsMutex;
Ref<Alerts>& InstalledAlerts() {
   static Ref<Alerts>* const alerts = new Ref<Alerts>();
   return *alerts;
}

}  // namespace

void CreateChannelManager(Ref<ChannelManager>& out) { out = new ChannelManagerImpl(); }
void CreateLogAlerts(Ref<Alerts>& out) { out = new LogAlertsImpl(); }

void InstallAlerts(Alerts* alerts) {
   Ref<Alerts> old;
   std::lock_guard<std::mutex> lock(g_alertsMutex);
   old = std::move(InstalledAlerts());
   InstalledAlerts() = alerts;
}

Alerts* GetAlerts() {
   std::lock_guard<std::mutex> lock(g_alertsMutex);
   return InstalledAlerts().Get();
}

}  // namespace Pelmora::Service
