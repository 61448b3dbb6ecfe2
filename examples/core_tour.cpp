// A tour of the core: objects and a weak reference, a formatted message, and an
// exception caught, cloned, rethrown and printed with its backtrace.

#include <iostream>
#include <memory>

#include "pelmora/pelmora.h"

using namespace Pelmora;

namespace {

// A session of some daemon: reference counted, and reachable through weak references.
class Session : public WeakLinkableImpl<> {
public:
   explicit Session(std::string user) : _user(std::move(user)) {}
   const std::string& GetUser() const { return _user; }

private:
   std::string _user;
};

}  // namespace

// Exported, so that its frame is named in the backtrace.
void OpenConfiguration(const std::string& path) {
   throw FileIONotFoundException("Failed to open read file", path);
}

int main() {
   Ref<Session> session = new Session("operator");
   WeakRef<Session> observer = session;
   std::cout << MessageFormatter::ASPrint("%1 belongs to %2 (%3 reference)\n", session,
                                          session->GetUser(), session->GetRefCount());

   if (Ref<Session> promoted = observer.Promote()) {
      std::cout << "weak reference promoted while the session lives\n";
   }
   session.Reset();
   std::cout << "after the last reference: promoted = " << std::boolalpha
             << static_cast<bool>(observer.Promote()) << ", detached = " << observer.IsDetached()
             << "\n";

   std::unique_ptr<Exception> kept;
   try {
      OpenConfiguration("/etc/daemon/settings.xml");
   } catch (const Exception& e) {
      kept.reset(e.Clone());  // kept for later, e.g. to hand to another thread
   }
   try {
      kept->Throw();
   } catch (const FileIONotFoundException& e) {
      std::cout << MessageFormatter::ASPrint("rethrown as its own type: %1 (path %2)\n", e,
                                             e.GetPath());
      std::cout << "thrown at:\n" << e.Where();
   }

   std::string scores;
   ObjectImpl::GetScores(scores);
   std::cout << "live objects per class:\n" << scores;
   return 0;
}
