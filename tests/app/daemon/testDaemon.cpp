// A daemon as a program would write one: InitApp from the configuration file in argv[1],
// the exit status in argv[2], Run until stopped, Exit. With argv[3] "quick" it ends
// through QuickExit, with "return" by returning from main.

#include <cstdlib>
#include <string>

#include "pelmora/service.h"

int main(int argc, char** argv) {
   if (argc < 3) return 2;
   using namespace Pelmora::Service;
   InitApp(argv[1]);
   App* app = GetApp();
   app->SetExitStatus(atoi(argv[2]));
   app->Run();
   int status = app->GetExitStatus();
   app->Exit();
   if (argc > 3 && std::string(argv[3]) == "quick") QuickExit(status);
   return status;
}
