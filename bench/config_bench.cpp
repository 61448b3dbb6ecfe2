// Configuration benchmarks: a typed read of a three-segment path in a tree of 10,000
// keys against a std::map lookup of the joined path, and loading a 1 MB XML configuration
// against the XML parser alone on the same bytes (the cost of the tree on top of the DOM).

#include <map>
#include <string>
#include <vector>

#include "pelmora/service/config.h"
#include "pelmora/xml.h"
#include "support/ratioMain.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

// 10 sections x 10 groups x 100 keys.
std::vector<std::string> KeyPaths() {
   std::vector<std::string> paths;
   for (int s = 0; s < 10; ++s) {
      for (int g = 0; g < 10; ++g) {
         for (int k = 0; k < 100; ++k) {
            paths.push_back("section" + std::to_string(s) + "/group" + std::to_string(g) + "/key" +
                            std::to_string(k));
         }
      }
   }
   return paths;
}

// Every 37th key, so that successive reads wander over the tree.
std::vector<std::string> Probes(const std::vector<std::string>& paths) {
   std::vector<std::string> probes;
   for (size_t i = 0; i < paths.size(); i += 37) probes.push_back(paths[i]);
   return probes;
}

void BM_ConfigGetThreeSegments(benchmark::State& state) {
   std::vector<std::string> paths = KeyPaths();
   Ref<Config> config;
   CreateScratchConfig(config);
   Ref<Config::View> view;
   config->GetMainView(view);
   for (const std::string& path : paths) view->Set(path, "value of " + path);
   std::vector<std::string> probes = Probes(paths);
   std::string value;
   size_t i = 0;
   for (auto _ : state) {
      bool found = view->Get(probes[i], &value);
      benchmark::DoNotOptimize(found);
      if (++i == probes.size()) i = 0;
   }
}
BENCHMARK(BM_ConfigGetThreeSegments);

void BM_MapGetJoinedPath(benchmark::State& state) {
   std::vector<std::string> paths = KeyPaths();
   std::map<std::string, std::string> map;
   for (const std::string& path : paths) map[path] = "value of " + path;
   std::vector<std::string> probes = Probes(paths);
   std::string value;
   size_t i = 0;
   for (auto _ : state) {
      auto it = map.find(probes[i]);
      bool found = it != map.end();
      if (found) value = it->second;
      benchmark::DoNotOptimize(found);
      if (++i == probes.size()) i = 0;
   }
}
BENCHMARK(BM_MapGetJoinedPath);

// About 1 MB: sections of entries with ids, each with a few values.
std::string MegabyteXml() {
   std::string xml = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<config>\n";
   for (int s = 0; xml.size() < (1u << 20); ++s) {
      xml += "  <section id=\"" + std::to_string(s) + "\">\n";
      for (int e = 0; e < 20; ++e) {
         xml += "    <entry id=\"" + std::to_string(e) + "\">\n";
         xml += "      <name>entry " + std::to_string(e) + " of section " + std::to_string(s) + "</name>\n";
         xml += "      <level>info</level>\n      <limit>" + std::to_string(e * 1000) + "</limit>\n";
         xml += "    </entry>\n";
      }
      xml += "  </section>\n";
   }
   return xml + "</config>\n";
}

void BM_ConfigLoadXml1MB(benchmark::State& state) {
   std::string xml = MegabyteXml();
   for (auto _ : state) {
      Ref<Config> config;
      CreateXmlStringConfig(xml, config);
      benchmark::DoNotOptimize(config.Get());
   }
   state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(xml.size()));
}
BENCHMARK(BM_ConfigLoadXml1MB)->Unit(benchmark::kMillisecond);

void BM_XmlParse1MB(benchmark::State& state) {
   std::string xml = MegabyteXml();
   for (auto _ : state) {
      // As the configuration does: a pooled parser, restricted input.
      Ref<Xml::XMLParserPool::ParserLease> lease;
      Xml::GetXmlParserPool()->GetParserLease(lease);
      Ref<Object> document;
      lease->GetParser()->Parse(xml, true, document);
      benchmark::DoNotOptimize(document.Get());
   }
   state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(xml.size()));
}
BENCHMARK(BM_XmlParse1MB)->Unit(benchmark::kMillisecond);

}  // namespace

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(argc, argv,
                                      {{"BM_ConfigGetThreeSegments", "BM_MapGetJoinedPath"},
                                       {"BM_ConfigLoadXml1MB", "BM_XmlParse1MB"}});
}
