// The application object: creation, start-up from a configuration file, the registry,
// Run/Stop/Exit and the exit paths. Start-up changes the whole process, so each scenario
// runs in a child of its own.

#include <gtest/gtest.h>

#include "pelmora/exception/debugConfig.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/service.h"
#include "pelmora/xml/parser.h"
#include "src/app/appImpl.h"
#include "tests/support/appProcess.h"

namespace Pelmora::Service {
namespace {

using Testing::Contains;
using Testing::CountOf;
using Testing::ReadText;
using Testing::ScratchDir;
using Testing::WriteText;

// A configuration that logs to `dir`/app.log at trivia, with `extra` inside <config>.
// `pelmora` goes inside <pelmora>.
std::string WriteConfig(const ScratchDir& dir, const std::string& extra,
                        const std::string& pelmora = "") {
   std::string path = dir / "app.xml";
   WriteText(path, "<config><log><directory>" + dir.Path() +
                       "</directory><name>app.log</name><level>trivia</level>"
                       "<flushIntervalMs>1</flushIntervalMs></log>"
                       "<pelmora><daemon><handleSignals>false</handleSignals></daemon>"
                       "<threadPool><minThreads>1</minThreads></threadPool>" + pelmora + "</pelmora>" +
                       extra + "</config>");
   return path;
}

std::string LogOf(const ScratchDir& dir) {
   GetDefaultLogManager()->Flush();
   return ReadText(dir / "app.log");
}

// Runs `scenario` in a child that must end with status 0 (a failed check ends it with 100).
void InChild(const std::function<void()>& scenario) {
   EXPECT_EXIT((scenario(), _exit(0)), testing::ExitedWithCode(0), "");
}

class TestObject : public ObjectImpl {};

TEST(AppRegistryTest, RegistersLooksUpAndRefusesDuplicatesAndAbsentNames) {
   Ref<AppImpl> app = new AppImpl();
   Ref<Object> first = new TestObject(), second = new TestObject();
   app->RegisterObject("first", first.Get());
   app->RegisterObject("second", second.Get());
   EXPECT_EQ(first->GetRefCount(), 2);  // the registry holds its own reference
   EXPECT_THROW(app->RegisterObject("first", second.Get()), AlreadyExistsException);

   Ref<Object> found;
   app->LookupObject("second", found);
   EXPECT_EQ(found.Get(), second.Get());
   RefMap<std::string, Object> all;
   app->GetObjects(all);
   ASSERT_EQ(all.size(), 2u);
   EXPECT_EQ(all["first"].Get(), first.Get());

   all.clear();
   app->UnregisterObject("first");
   EXPECT_EQ(first->GetRefCount(), 1);
   EXPECT_THROW(app->UnregisterObject("first"), NotFoundException);
   EXPECT_THROW(app->LookupObject("first", found), NotFoundException);
   app->GetObjects(all);
   EXPECT_EQ(all.size(), 1u);
}

TEST(AppTest, ExitBeforeInitAndStopBeforeThePoolDoNothing) {
   Ref<AppImpl> app = new AppImpl();
   app->Stop();
   app->Exit();
   EXPECT_FALSE(app->GetThreadPool());
}

TEST(AppDeathTest, OnlyOneApplicationPerProcess) {
   InChild([&] {
      APP_CHILD_CHECK(GetApp() == nullptr);
      CreateApp();
      App* app = GetApp();
      APP_CHILD_CHECK(app != nullptr);
      try {
         CreateApp();
         APP_CHILD_CHECK(!"second CreateApp returned");
      } catch (const AlreadyInitializedException& e) {
         APP_CHILD_CHECK(e.GetMessage() == "Already initialized");
      }
      APP_CHILD_CHECK(GetApp() == app);
   });
}

TEST(AppDeathTest, SetAppInfoRefusesNull) {
   EXPECT_DEATH(SetAppInfo(nullptr), "Assert Failed:.*info");
}

TEST(AppDeathTest, StartsFromAConfigurationFileRunsUntilStopAndExitsCleanly) {
   ScratchDir dir;
   std::string config = WriteConfig(
       dir, "<workingDir>" + dir.Path() + "</workingDir>",
       "<xml><doc><maxDepth>7</maxDepth></doc></xml><debug><prefetchSymbols>true</prefetchSymbols>"
       "<resolveSymbols>false</resolveSymbols><exceptionBacktraceLogSize>12"
       "</exceptionBacktraceLogSize></debug>");
   InChild([&] {
      SetAppInfo(new AppInfo("tester", "1.2"));
      InitApp(config);
      App* app = GetApp();
      APP_CHILD_CHECK(app->GetThreadPool().Get() == System::GetThreadPool());
      APP_CHILD_CHECK(app->GetConfig());
      APP_CHILD_CHECK(app->GetAppLogger().Get() == GetDefaultLogger());
      APP_CHILD_CHECK(app->GetAppInfo()->GetName() == "tester");
      APP_CHILD_CHECK(GetAlerts() != nullptr);
      APP_CHILD_CHECK(Xml::GetDefaultDocLimits().maxDepth == 7);
      char cwd[4096];
      APP_CHILD_CHECK(getcwd(cwd, sizeof(cwd)) && std::string(cwd) == dir.Path());
      std::string log = LogOf(dir);
      // The start-up steps in their order.
      const char* steps[] = {"Logging uses fast path: true",
                             "Handling tarn/lib logs with PelMora facilities",
                             "Initialized channel manager",
                             "Current working directory: ",
                             "Executable directory: ",
                             "Plugin base directory: "};
      size_t at = 0;
      for (const char* step : steps) {
         size_t found = log.find(step, at);
         if (found == std::string::npos) fprintf(stderr, "missing or out of order: %s\n", step);
         APP_CHILD_CHECK(found != std::string::npos);
         at = found;
      }
      DebugConfig& debug = GetDebugConfig();
      APP_CHILD_CHECK(debug.GetPrefetchSymbols() && !debug.GetPrefetchCoreDumpLibs());
      APP_CHILD_CHECK(!debug.GetResolveSymbols() && debug.GetExceptionBacktrace() == 12);

      // Run lends the main thread to the pool until Stop.
      std::atomic<bool> ranOnMain{false};
      pthread_t mainThread = pthread_self();
      app->GetThreadPool()->GetMainThreadWorkQueue()->Enqueue(System::Functor<>([&] {
         ranOnMain = pthread_equal(pthread_self(), mainThread) != 0;
         GetApp()->SetExitStatus(9);
         GetApp()->Stop();
      }));
      app->Run();
      APP_CHILD_CHECK(ranOnMain.load());
      APP_CHILD_CHECK(app->GetExitStatus() == 9);
      app->Exit();
      APP_CHILD_CHECK(GetApp() == nullptr);
      APP_CHILD_CHECK(System::GetThreadPool()->IsShuttingDown());
   });
}

TEST(AppDeathTest, ConfigurationErrorsAreLoggedAndStartUpGoesOn) {
   ScratchDir dir;
   std::string config = WriteConfig(
       dir, "<workingDir>" + dir.Path() + "/absent</workingDir><panicOnNewFailure>maybe"
            "</panicOnNewFailure>", "<handleTarnLogging>false</handleTarnLogging>");
   InChild([&] {
      InitApp(config);
      std::string log = LogOf(dir);
      APP_CHILD_CHECK(Contains(log, "Failed to set the current working directory: " +
                                        dir.Path() + "/absent, No such file"));
      APP_CHILD_CHECK(Contains(log, "Encountered errors while reading panicOnNewFailure "
                                    "parameter: "));
      APP_CHILD_CHECK(Contains(log, " assuming default value (false)"));
      APP_CHILD_CHECK(Contains(log, "tarn/lib logs will NOT be handled by PelMora"));
      APP_CHILD_CHECK(GetApp()->GetThreadPool());
      GetApp()->Exit();
   });
}

TEST(AppDeathTest, PlainExitWithTheAlertOnEndsWithStatusZeroAndAWarning) {
   ScratchDir dir;
   std::string config =
       WriteConfig(dir, "", "<alertOnMissingQuickExit>true</alertOnMissingQuickExit>");
   EXPECT_EXIT(
       ([&] {
          InitApp(config);
          APP_CHILD_CHECK(GetAlertOnMissingQuickExit());
          exit(7);
       })(),
       testing::ExitedWithCode(0),
       "WARNING: This application is not using QuickExit\\(\\). The exit code will be set to 0.");
   EXPECT_EXIT((InitApp(config), QuickExit(7)), testing::ExitedWithCode(7), "");
}

TEST(AppDeathTest, ThreeArgumentInitAppPutsTheLogNameAndDirectoryBehindTheFile) {
   ScratchDir dir;
   std::string config = dir / "plain.xml";
   WriteText(config, "<config><log><level>info</level></log><pelmora><daemon><handleSignals>"
                     "false</handleSignals></daemon></pelmora></config>");
   InChild([&] {
      InitApp("named.log", dir.Path(), config);
      GetDefaultLogManager()->Flush();
      APP_CHILD_CHECK(Contains(ReadText(dir / "named.log"), "Logging uses fast path"));
      GetApp()->Exit();
   });
}

}  // namespace
}  // namespace Pelmora::Service
