// Plug-ins: dependency ordering with its complaints, and real shared objects loaded in
// that order, initialised and started in load order and shut down in reverse.

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service.h"
#include "src/app/appImpl.h"
#include "tests/support/appProcess.h"

namespace Pelmora::Service {
namespace {

using Testing::Contains;
using Testing::ReadText;
using Testing::ScratchDir;
using Testing::WriteText;

using List = std::vector<std::pair<std::string, std::vector<std::string>>>;

std::string OrderError(const List& plugins) {
   std::vector<std::string> order;
   try {
      OrderPlugins(plugins, order);
   } catch (const InvalidStateException& e) {
      return e.GetMessage();
   }
   return "";
}

TEST(PluginOrderTest, EveryPluginComesAfterItsDependencies) {
   std::vector<std::string> order;
   OrderPlugins({{"app", {"net", "db"}}, {"db", {"core"}}, {"net", {"core"}}, {"core", {}}},
                order);
   EXPECT_EQ(order, (std::vector<std::string>{"core", "net", "db", "app"}));
   OrderPlugins({}, order);
   EXPECT_TRUE(order.empty());
}

TEST(PluginOrderTest, CyclesAndMissingDependenciesAreNamed) {
   EXPECT_EQ(OrderError({{"A", {"B"}}, {"B", {"A"}}}), "Cyclic dependency detected for plugin: A");
   EXPECT_EQ(OrderError({{"A", {"A"}}}), "Cyclic dependency detected for plugin: A");
   EXPECT_EQ(OrderError({{"x", {}}, {"A", {"B"}}, {"B", {"C"}}, {"C", {"B"}}}),
             "Cyclic dependency detected for plugin: B");
   EXPECT_EQ(OrderError({{"A", {"B"}}, {"B", {"Z"}}}), "Missing dependency [Z] for plugin [B]");
   // A plug-in reached twice without a cycle is fine.
   EXPECT_EQ(OrderError({{"A", {"B", "C"}}, {"B", {"C"}}, {"C", {}}}), "");
}

TEST(SharedLibraryTest, OpensFindsSymbolsAndTellsAMissingFileApart) {
   Ref<System::SharedLibrary> library;
   System::OpenSharedLibrary(PELMORA_TEST_PLUGIN_DIR "/libalpha.so", library);
   EXPECT_NE(library->FindSymbol("PelmoraPluginEntry"), nullptr);
   EXPECT_EQ(library->FindSymbol("NoSuchSymbol"), nullptr);
   EXPECT_THROW(System::OpenSharedLibrary(PELMORA_TEST_PLUGIN_DIR "/libabsent.so", library),
                FileIONotFoundException);
   EXPECT_THROW(System::OpenSharedLibrary("libpelmora-absent.so", library), FileIONotFoundException);
   ScratchDir dir;
   WriteText(dir / "bad.so", "not a library");
   EXPECT_THROW(System::OpenSharedLibrary(dir / "bad.so", library), SystemException);
}

// Runs `scenario` in a child that must end with status 0 (a failed check ends it with 100).
void InChild(const std::function<void()>& scenario) {
   EXPECT_EXIT((scenario(), _exit(0)), testing::ExitedWithCode(0), "");
}

std::string PluginConfig(const ScratchDir& dir, const std::string& plugins) {
   std::string path = dir / "app.xml";
   WriteText(path, "<config><log><directory>" + dir.Path() +
                       "</directory><name>app.log</name><level>info</level></log>"
                       "<pelmora><daemon><handleSignals>false</handleSignals></daemon></pelmora>"
                       "<plugins>" + plugins + "</plugins></config>");
   return path;
}

TEST(PluginDeathTest, RealPluginsLoadInDependencyOrderAndShutDownInReverse) {
   ScratchDir dir;
   // alpha needs gamma and beta; beta needs gamma. gamma exports only the older entry
   // name, and beta is found through the base directory.
   std::string config = PluginConfig(
       dir, "<baseDirectory>" PELMORA_TEST_PLUGIN_DIR "</baseDirectory>"
            "<alpha><path>" PELMORA_TEST_PLUGIN_DIR "/libalpha.so</path>"
            "<depends><a>gamma</a><b>beta</b></depends></alpha>"
            "<beta><path>libbeta.so</path><depends><a>gamma</a></depends></beta>"
            "<gamma><path>" PELMORA_TEST_PLUGIN_DIR "/libgamma.so</path></gamma>"
            "<delta><enable>false</enable><path>/nowhere/libdelta.so</path></delta>");
   std::string trace = dir / "trace";
   setenv("PELMORA_TEST_PLUGIN_TRACE", trace.c_str(), 1);
   InChild([&] {
      InitApp(config);
      App* app = GetApp();
      App::PluginMap plugins;
      app->GetPlugins(plugins);
      APP_CHILD_CHECK(plugins.size() == 3);
      APP_CHILD_CHECK(plugins["beta"].second->GetPath() == "libbeta.so" ||
                      plugins["beta"].second->GetPath() ==
                          PELMORA_TEST_PLUGIN_DIR "/libbeta.so");
      plugins.clear();
      app->StartPlugins();
      app->Exit();
      std::string log = ReadText(dir / "app.log");
      APP_CHILD_CHECK(Contains(log, "Plugin base directory: " PELMORA_TEST_PLUGIN_DIR));
      APP_CHILD_CHECK(Contains(log, "Trying beta"));
      APP_CHILD_CHECK(Contains(log, "Plugin beta path: libbeta.so"));
      APP_CHILD_CHECK(
          Contains(log, "Plugin beta absolute path: " PELMORA_TEST_PLUGIN_DIR "/libbeta.so"));
      APP_CHILD_CHECK(Contains(
          log, "NotFound, reload: Plugin beta absolute path: " PELMORA_TEST_PLUGIN_DIR));
      APP_CHILD_CHECK(!Contains(log, "delta"));
      std::string calls = ReadText(trace);
      if (calls != "gamma:entry\nbeta:entry\nalpha:entry\n"
                   "gamma:init\nbeta:init\nalpha:init\n"
                   "gamma:start\nbeta:start\nalpha:start\n"
                   "alpha:shutdown\nalpha:released\nbeta:shutdown\nbeta:released\n"
                   "gamma:shutdown\ngamma:released\n") {
         fprintf(stderr, "calls:\n%s", calls.c_str());
         _exit(100);
      }
   });
   unsetenv("PELMORA_TEST_PLUGIN_TRACE");
}

// Ordering errors (their texts are checked above) stop all loading.
TEST(PluginDeathTest, AnOrderingErrorLoadsNothingAndIsLogged) {
   ScratchDir dir;
   std::string cyclic = PluginConfig(
       dir, "<alpha><path>" PELMORA_TEST_PLUGIN_DIR "/libalpha.so</path><depends><a>beta</a>"
            "</depends></alpha><beta><path>" PELMORA_TEST_PLUGIN_DIR "/libbeta.so</path>"
            "<depends><a>alpha</a></depends></beta>");
   InChild([&] {
      InitApp(cyclic);
      App::PluginMap plugins;
      GetApp()->GetPlugins(plugins);
      APP_CHILD_CHECK(plugins.empty());
      GetDefaultLogManager()->Flush();
      APP_CHILD_CHECK(Contains(ReadText(dir / "app.log"),
                               "Cyclic dependency detected for plugin: alpha"));
   });
}

}  // namespace
}  // namespace Pelmora::Service
