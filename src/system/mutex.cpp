// Creation of the library's mutex for the system factory.

#include "src/system/mutexImpl.h"
#include "src/system/systemImpl.h"

namespace Pelmora::System {

void CreateMutexImpl(Ref<Mutex>& out) {
   out = new MutexImpl();
}

}  // namespace Pelmora::System
