#include <gtest/gtest.h>
#include <gmock/gmock.h>

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <set>
#include <stdexcept>

#include "pelmora/io/writers.h"
#include "pelmora/perfCounter.h"

namespace Pelmora::PerfCounter {
namespace {

using testing::ElementsAre;
using testing::Pair;

// A strict reader of the text exposition format 0.0.4: it throws on anything a
// Prometheus server would refuse to ingest.
struct Sample {
   std::string name;
   std::map<std::string, std::string> labels;
   double value;
};
struct Family {
   std::string type, help;
   std::vector<Sample> samples;
};

class ExpositionParser {
public:
   std::map<std::string, Family> Parse(const std::string& text) {
      if (!text.empty() && text.back() != '\n') Fail("missing final newline");
      size_t start = 0;
      while (start < text.size()) {
         size_t end = text.find('\n', start);
         _line = text.substr(start, end - start);
         start = end + 1;
         if (_line.empty()) continue;
         if (_line[0] == '#') {
            Comment();
         } else {
            SampleLine();
         }
      }
      return _families;
   }

private:
   [[noreturn]] void Fail(const std::string& why) {
      throw std::runtime_error(why + " in line: " + _line);
   }

   static bool IsMetricName(const std::string& name) {
      if (name.empty()) return false;
      for (size_t i = 0; i < name.size(); ++i) {
         char c = name[i];
         bool ok = isalpha(static_cast<unsigned char>(c)) || c == '_' || c == ':' || (i > 0 && isdigit(static_cast<unsigned char>(c)));
         if (!ok) return false;
      }
      return true;
   }
   static bool IsLabelName(const std::string& name) {
      return IsMetricName(name) && name.find(':') == std::string::npos && name.rfind("__", 0) != 0;
   }

   void Comment() {
      if (_line.rfind("# HELP ", 0) != 0 && _line.rfind("# TYPE ", 0) != 0) return;
      std::string rest = _line.substr(7);
      size_t space = rest.find(' ');
      if (space == std::string::npos) Fail("no text");
      std::string name = rest.substr(0, space), text = rest.substr(space + 1);
      if (!IsMetricName(name)) Fail("bad family name");
      Family& family = Enter(name);
      if (_line[2] == 'H') {
         if (!family.help.empty()) Fail("second HELP");
         for (size_t i = 0; i < text.size(); ++i) {
            if (text[i] == '\\' && (i + 1 >= text.size() || (text[i + 1] != '\\' && text[i + 1] != 'n'))) {
               Fail("bad escape in HELP");
            }
            if (text[i] == '\\') ++i;
         }
         family.help = text;
      } else {
         static const std::set<std::string> kTypes = {"counter", "gauge", "histogram", "summary", "untyped"};
         if (!family.type.empty()) Fail("second TYPE");
         if (!family.samples.empty()) Fail("TYPE after samples");
         if (!kTypes.count(text)) Fail("unknown type");
         family.type = text;
      }
   }

   // Families must be contiguous: returning to an earlier one is an error.
   Family& Enter(const std::string& name) {
      if (name != _current) {
         if (_families.count(name)) Fail("family " + name + " is not contiguous");
         _current = name;
      }
      return _families[name];
   }

   std::string FamilyOf(const std::string& sampleName) {
      for (const char* suffix : {"_sum", "_count"}) {
         std::string s = suffix;
         if (sampleName.size() > s.size() && sampleName.compare(sampleName.size() - s.size(), s.size(), s) == 0) {
            std::string base = sampleName.substr(0, sampleName.size() - s.size());
            if (base == _current && _families[base].type == "summary") return base;
         }
      }
      return sampleName;
   }

   void SampleLine() {
      size_t i = 0;
      while (i < _line.size() && _line[i] != '{' && _line[i] != ' ') ++i;
      Sample sample;
      sample.name = _line.substr(0, i);
      if (!IsMetricName(sample.name)) Fail("bad metric name");
      if (i < _line.size() && _line[i] == '{') {
         ++i;
         while (i < _line.size() && _line[i] != '}') {
            size_t eq = _line.find('=', i);
            if (eq == std::string::npos) Fail("label without =");
            std::string label = _line.substr(i, eq - i);
            if (!IsLabelName(label)) Fail("bad label name");
            if (eq + 1 >= _line.size() || _line[eq + 1] != '"') Fail("unquoted label value");
            std::string value;
            size_t j = eq + 2;
            for (; j < _line.size() && _line[j] != '"'; ++j) {
               if (_line[j] == '\\') {
                  char next = j + 1 < _line.size() ? _line[j + 1] : '\0';
                  if (next == '\\') value += '\\';
                  else if (next == '"') value += '"';
                  else if (next == 'n') value += '\n';
                  else Fail("bad escape in label value");
                  ++j;
               } else {
                  value += _line[j];
               }
            }
            if (j >= _line.size()) Fail("unterminated label value");
            if (!sample.labels.emplace(label, value).second) Fail("duplicate label");
            i = j + 1;
            if (i < _line.size() && _line[i] == ',') ++i;
         }
         if (i >= _line.size()) Fail("unterminated label set");
         ++i;
      }
      if (i >= _line.size() || _line[i] != ' ') Fail("no value");
      std::string valueText = _line.substr(i + 1);
      if (valueText.find(' ') != std::string::npos) Fail("unexpected timestamp or text");
      if (valueText == "NaN") {
         sample.value = NAN;
      } else if (valueText == "+Inf" || valueText == "-Inf") {
         sample.value = valueText[0] == '-' ? -INFINITY : INFINITY;
      } else {
         size_t used = 0;
         try {
            sample.value = std::stod(valueText, &used);
         } catch (const std::exception&) {
            Fail("bad value");
         }
         if (used != valueText.size()) Fail("bad value");
      }
      std::string familyName = FamilyOf(sample.name);
      Family& family = Enter(familyName);
      if (family.type == "summary" && sample.name == familyName && !sample.labels.count("quantile")) {
         Fail("summary sample without quantile");
      }
      if (family.type != "summary" && sample.labels.count("quantile")) Fail("stray quantile");
      std::string series = sample.name;
      for (const auto& [k, v] : sample.labels) series += "|" + k + "=" + v;
      if (!_series.insert(series).second) Fail("duplicate series");
      family.samples.push_back(sample);
   }

   std::string _line, _current;
   std::map<std::string, Family> _families;
   std::set<std::string> _series;
};

class Fixed : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit Fixed(std::vector<long long> values) : _values(std::move(values)) {}
   void CollectValues(RefVector<Metadata>&, std::vector<Value>& values) override {
      for (long long v : _values) values.emplace_back(v);
   }

private:
   std::vector<long long> _values;
};

class PrometheusTest : public testing::Test {
protected:
   void SetUp() override { CreateCounterRegistry(registry); }
   void TearDown() override {
      for (auto& item : items) item->Unregister();
   }

   void Add(const std::string& name, Metadata::Type type, long long value) {
      RefVector<Metadata> metadata = {new Metadata(name, type)};
      Ref<GroupPublisher> publisher = new Fixed({value});
      Ref<RegistryItem> item;
      registry->RegisterGroup(metadata, publisher.Get(), item);
      items.push_back(item);
   }

   std::string Export() {
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      WritePrometheusText(registry.Get(), writer.Get());
      return writer->GetString();
   }

   std::map<std::string, Family> Parsed() {
      std::string text = Export();
      try {
         return ExpositionParser().Parse(text);
      } catch (const std::exception& e) {
         ADD_FAILURE() << e.what() << "\n" << text;
         return {};
      }
   }

   Ref<Registry> registry;
   RefVector<RegistryItem> items;
};

TEST_F(PrometheusTest, PathsBecomeNamesAndQuotedComponentsLabels) {
   Add("/Pool/Thread='io'/Busy", Metadata::TYPE_GAUGE, 3);
   Add("/Pool/Thread='cpu'/Busy", Metadata::TYPE_GAUGE, 4);
   Add("/Http/Requests-Total", Metadata::TYPE_COUNTER, 17);
   Add("/2xx/count", Metadata::TYPE_COUNTER, 5);
   Add("/Edge/Name='a\"b\\c'/Last='x'", Metadata::TYPE_GAUGE, -1);
   EXPECT_EQ(
       "# HELP Edge_Last__x_ Gauge /Edge/Name='*'/Last='x'\n"
       "# TYPE Edge_Last__x_ gauge\n"
       "Edge_Last__x_{Name=\"a\\\"b\\\\c\"} -1\n"
       "# HELP Http_Requests_Total Counter /Http/Requests-Total\n"
       "# TYPE Http_Requests_Total counter\n"
       "Http_Requests_Total 17\n"
       "# HELP Pool_Busy Gauge /Pool/Thread='*'/Busy\n"
       "# TYPE Pool_Busy gauge\n"
       "Pool_Busy{Thread=\"cpu\"} 4\n"
       "Pool_Busy{Thread=\"io\"} 3\n"
       "# HELP _2xx_count Counter /2xx/count\n"
       "# TYPE _2xx_count counter\n"
       "_2xx_count 5\n",
       Export());
   auto families = Parsed();
   EXPECT_EQ("a\"b\\c", families["Edge_Last__x_"].samples[0].labels["Name"]);
}

TEST_F(PrometheusTest, MetersBecomeSummariesWithAMeanGauge) {
   MeterAccumulator latency(registry.Get(), "/Http/Method='GET'/Latency");
   latency.Publish();
   for (long long v : {5, 2, 8}) latency.Sample(v);
   MeterAccumulator idle(registry.Get(), "/Idle");
   idle.Publish();
   MeterAccumulator partial(registry.Get(), "/Partial");
   partial.SetCounterVisible(Meter::COUNTER_MIN, false);
   partial.SetCounterVisible(Meter::COUNTER_MEAN, false);
   partial.Publish();
   partial.Sample(4);

   auto families = Parsed();
   ASSERT_EQ(5u, families.size());
   const Family& summary = families["Http_Latency"];
   EXPECT_EQ("summary", summary.type);
   EXPECT_EQ("Meter /Http/Method='*'/Latency", summary.help);
   std::vector<std::pair<std::string, double>> seen;
   for (const Sample& s : summary.samples) {
      EXPECT_EQ("GET", s.labels.at("Method"));
      seen.emplace_back(s.name + (s.labels.count("quantile") ? "@" + s.labels.at("quantile") : ""), s.value);
   }
   EXPECT_THAT(seen, ElementsAre(Pair("Http_Latency@0", 2), Pair("Http_Latency@1", 8),
                                 Pair("Http_Latency_sum", 15), Pair("Http_Latency_count", 3)));
   EXPECT_EQ("gauge", families["Http_Latency_mean"].type);
   EXPECT_EQ(5, families["Http_Latency_mean"].samples[0].value);

   // Without samples the extremes and the mean are not numbers.
   ASSERT_EQ(4u, families["Idle"].samples.size());
   EXPECT_TRUE(std::isnan(families["Idle"].samples[0].value));
   EXPECT_EQ(0, families["Idle"].samples[2].value);
   EXPECT_TRUE(std::isnan(families["Idle_mean"].samples[0].value));
   ASSERT_EQ(3u, families["Partial"].samples.size());
   EXPECT_EQ(0u, families.count("Partial_mean"));
}

TEST_F(PrometheusTest, ClashingSeriesKeepTheFirstInNameOrder) {
   Add("/a-b", Metadata::TYPE_GAUGE, 1);
   Add("/a_b", Metadata::TYPE_GAUGE, 2);       // same series as /a-b
   Add("/a_b_c", Metadata::TYPE_COUNTER, 3);
   Add("/a.b.c", Metadata::TYPE_GAUGE, 4);     // a_b_c of another type, earlier in order
   MeterAccumulator meter(registry.Get(), "/m");
   meter.Publish();
   meter.Sample(9);
   Add("/m_sum", Metadata::TYPE_GAUGE, 5);     // taken by the meter's summary
   Add("/m_mean", Metadata::TYPE_GAUGE, 6);    // taken by the meter's mean
   auto families = Parsed();
   EXPECT_EQ(1, families["a_b"].samples.at(0).value);
   EXPECT_EQ(1u, families["a_b"].samples.size());
   EXPECT_EQ("gauge", families["a_b_c"].type);
   EXPECT_EQ(4, families["a_b_c"].samples.at(0).value);
   EXPECT_EQ(0u, families.count("m_sum"));
   ASSERT_EQ(1u, families["m_mean"].samples.size());
   EXPECT_EQ(9, families["m_mean"].samples[0].value);
}

TEST_F(PrometheusTest, ManyCountersExportAsAValidDocument) {
   for (int i = 0; i < 500; ++i) {
      Add("/Load/Shard='" + std::to_string(i % 7) + "'/N" + std::to_string(i / 7),
          (i / 7) % 2 ? Metadata::TYPE_COUNTER : Metadata::TYPE_GAUGE, i);
   }
   auto families = Parsed();
   size_t samples = 0;
   for (const auto& [name, family] : families) samples += family.samples.size();
   EXPECT_EQ(500u, samples);
}

// The Prometheus server's own checker, when the machine has it.
std::string FindPromtool() {
   const char* path = std::getenv("PATH");
   std::string dirs = path ? path : "/usr/bin:/bin";
   for (size_t start = 0; start <= dirs.size();) {
      size_t end = dirs.find(':', start);
      if (end == std::string::npos) end = dirs.size();
      std::string candidate = dirs.substr(start, end - start) + "/promtool";
      if (end > start && access(candidate.c_str(), X_OK) == 0) return candidate;
      start = end + 1;
   }
   return std::string();
}

TEST_F(PrometheusTest, PromtoolAcceptsTheExport) {
   std::string promtool = FindPromtool();
   if (promtool.empty()) GTEST_SKIP() << "promtool is not installed";
   Add("/Pool/Thread='io'/Busy", Metadata::TYPE_GAUGE, 3);
   Add("/Pool/Thread='cpu'/Busy", Metadata::TYPE_GAUGE, 4);
   Add("/Http/Requests-Total", Metadata::TYPE_COUNTER, 17);
   Add("/2xx/count", Metadata::TYPE_COUNTER, 5);
   Add("/Edge/Name='a\"b\\c\nd'/Last", Metadata::TYPE_GAUGE, -1);
   MeterAccumulator latency(registry.Get(), "/Http/Method='GET'/Latency");
   latency.Publish();
   latency.Sample(7);
   MeterAccumulator idle(registry.Get(), "/Idle");
   idle.Publish();
   std::string text = Export();

   char file[] = "/tmp/pelmora_prometheus_XXXXXX";
   int fd = mkostemp(file, O_CLOEXEC);
   ASSERT_GE(fd, 0);
   ASSERT_EQ(static_cast<ssize_t>(text.size()), write(fd, text.data(), text.size()));
   close(fd);
   std::string command = promtool + " check metrics < " + file + " 2>&1";
   FILE* pipe = popen(command.c_str(), "r");
   ASSERT_NE(nullptr, pipe);
   std::string report;
   char buffer[512];
   for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) report.append(buffer, n);
   int status = pclose(pipe);
   unlink(file);
   ASSERT_TRUE(WIFEXITED(status)) << report;
   // 0: clean; 3: only naming advice (units, suffixes). 1 would be a parse failure.
   int code = WEXITSTATUS(status);
   EXPECT_TRUE(code == 0 || code == 3) << "exit " << code << "\n" << report << "\n" << text;
   EXPECT_EQ(std::string::npos, report.find("error")) << report << "\n" << text;
   EXPECT_EQ(std::string::npos, report.find("no help text")) << report;

   // The checker must be able to fail: a broken document is refused.
   char brokenFile[] = "/tmp/pelmora_prometheus_XXXXXX";
   fd = mkostemp(brokenFile, O_CLOEXEC);
   ASSERT_GE(fd, 0);
   const std::string broken = "# TYPE x gauge\nx{a=\"1} 2\n";
   ASSERT_EQ(static_cast<ssize_t>(broken.size()), write(fd, broken.data(), broken.size()));
   close(fd);
   status = std::system((promtool + " check metrics < " + brokenFile + " > /dev/null 2>&1").c_str());
   unlink(brokenFile);
   EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 1) << status;
}

}  // namespace
}  // namespace Pelmora::PerfCounter
