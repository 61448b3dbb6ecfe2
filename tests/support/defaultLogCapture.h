#pragma once
// Keeps the default logger's text while it lives, through a writer of its own on the
// default output. Thread-safe.

#include <mutex>
#include <string>

#include "pelmora/service.h"

namespace Pelmora::TestSupport {

class DefaultLogCapture {
public:
   explicit DefaultLogCapture(const std::string& name) : _name(name), _target(new Target()) {
      Service::CreateLogWriter(name, _target.Get(), "trivia", _writer);
      Service::GetDefaultLogger()->GetLogOutput()->AddWriter(name, _writer.Get());
   }
   ~DefaultLogCapture() {
      Ref<Service::LogWriter> removed;
      Service::GetDefaultLogger()->GetLogOutput()->RemoveWriter(_name, removed);
   }
   std::string Text() { return _target->Text(); }
   bool Contains(const std::string& text) { return Text().find(text) != std::string::npos; }

private:
   class Target : public virtual Writer, public ObjectImpl {
   public:
      void Write(const char* data, int length) override {
         std::lock_guard<std::mutex> lock(_mutex);
         _text.append(data, length);
      }
      void Close() override {}
      std::string Text() {
         std::lock_guard<std::mutex> lock(_mutex);
         return _text;
      }

   private:
      std::mutex _mutex;
      std::string _text;
   };
   const std::string _name;
   Ref<Target> _target;
   Ref<Service::LogWriter> _writer;
};

}  // namespace Pelmora::TestSupport
