#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cmath>
#include <regex>
#include <set>
#include <sstream>

#include "pelmora/io/writers.h"
#include "tests/perfcounter/fixture.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::ElementsAre;
using testing::Pair;

struct Sample {
   std::string name;
   std::map<std::string, std::string> labels;
   double value;
};
struct Family {
   std::string type, help;
   std::vector<Sample> samples;
};

// A strict reader of the text exposition format 0.0.4: throws on anything a scraper would refuse.
std::map<std::string, Family> Parse(const std::string& text) {
   static const std::regex help(R"re(# HELP ([a-zA-Z_:][a-zA-Z0-9_:]*) ((?:[^\\]|\\[\\n])*))re"),
       type(R"re(# TYPE ([a-zA-Z_:][a-zA-Z0-9_:]*) (counter|gauge|histogram|summary|untyped))re"),
       sample(
           R"re(([a-zA-Z_:][a-zA-Z0-9_:]*)(?:\{(.*)\})? ([-+]?(?:[0-9]+\.?[0-9]*(?:e[-+]?[0-9]+)?|Inf)|NaN))re"),
       label(R"re(([a-zA-Z_][a-zA-Z0-9_]*)="((?:[^"\\]|\\[\\"n])*)"(?:,|$))re");
   std::map<std::string, Family> families;
   std::set<std::string> series;
   std::string current, line;
   auto fail = [&](const std::string& why) { throw std::runtime_error(why + " in line: " + line); };
   auto enter = [&](const std::string& name) -> Family& {
      if (name != current && families.count(name)) fail("family is not contiguous");
      current = name;
      return families[name];
   };
   if (!text.empty() && text.back() != '\n') fail("missing final newline");
   std::istringstream in(text);
   std::smatch m;
   while (std::getline(in, line)) {
      if (line.empty() || (line[0] == '#' && line.rfind("# HELP ", 0) && line.rfind("# TYPE ", 0)))
         continue;
      if (std::regex_match(line, m, help)) {
         Family& family = enter(m[1]);
         if (!family.help.empty()) fail("second HELP");
         family.help = m[2];
      } else if (std::regex_match(line, m, type)) {
         Family& family = enter(m[1]);
         if (!family.type.empty() || !family.samples.empty()) fail("second or late TYPE");
         family.type = m[2];
      } else if (std::regex_match(line, m, sample)) {
         Sample s{m[1], {}, std::stod(m[3])};
         std::string labels = m[2], key = s.name, familyName = s.name;
         std::smatch l;
         for (auto it = labels.cbegin(); it != labels.cend(); it = l[0].second) {
            if (!std::regex_search(it, labels.cend(), l, label,
                                   std::regex_constants::match_continuous))
               fail("bad labels");
            std::string raw = l[2], unescaped;
            for (size_t i = 0; i < raw.size(); ++i)
               unescaped += raw[i] != '\\' ? raw[i] : raw[++i] == 'n' ? '\n' : raw[i];
            if (l.str(1).rfind("__", 0) == 0 || !s.labels.emplace(l[1], unescaped).second)
               fail("bad label name");
            key += "|" + l.str(1) + "=" + unescaped;
         }
         for (std::string suffix : {"_sum", "_count"}) {
            if (families.count(current) && families[current].type == "summary" &&
                s.name == current + suffix)
               familyName = current;
         }
         Family& family = enter(familyName);
         if ((family.type == "summary" && s.name == familyName) != s.labels.count("quantile")) {
            fail("quantile misplaced");
         }
         if (!series.insert(key).second) fail("duplicate series");
         family.samples.push_back(s);
      } else {
         fail("unparsable");
      }
   }
   return families;
}

class PrometheusTest : public RegistryFixture {
protected:
   std::string Export() {
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      WritePrometheusText(registry.Get(), writer.Get());
      return writer->GetString();
   }
   std::map<std::string, Family> Parsed(std::string text = "") try {
      return Parse(text = Export());
   } catch (const std::exception& e) {
      ADD_FAILURE() << e.what() << "\n" << text;
      return {};
   }
   void AddMixed() {
      Add({"/Pool/Thread='io'/Busy"}, 3);
      Add({"/Pool/Thread='cpu'/Busy"}, 4);
      Add({"/Http/Requests-Total"}, 17, Metadata::TYPE_COUNTER);
      Add({"/2xx/count"}, 5, Metadata::TYPE_COUNTER);
   }
};

TEST_F(PrometheusTest, PathsBecomeNamesAndQuotedComponentsLabels) {
   AddMixed();
   Add({"/Edge/Name='a\"b\\c'/Last='x'"}, -1);
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
   EXPECT_EQ("a\"b\\c", Parsed()["Edge_Last__x_"].samples.at(0).labels["Name"]);
}

TEST_F(PrometheusTest, ReservedLabelNamesStayInTheMetricName) {
   // "__" names belong to the scraper and "quantile" to summaries: such components are refused
   // as labels and kept in the name.
   Add({"/Res/__name__='v'/quantile='q'/Val"}, 2);
   std::string text = Export();
   EXPECT_EQ(text.find('{'), std::string::npos) << text;
   auto families = Parsed();
   ASSERT_EQ(families.size(), 1u) << text;
   EXPECT_EQ(families.begin()->first, "Res___name____v__quantile__q__Val");
   EXPECT_TRUE(families.begin()->second.samples.at(0).labels.empty());
}

TEST_F(PrometheusTest, MetersBecomeSummariesWithAMeanGauge) {
   MeterAccumulator latency(registry.Get(), "/Http/Method='GET'/Latency"),
       idle(registry.Get(), "/Idle"), partial(registry.Get(), "/Partial");
   latency.Publish();
   for (long long v : {5, 2, 8}) latency.Sample(v);
   idle.Publish();
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
      seen.emplace_back(s.name + (s.labels.count("quantile") ? "@" + s.labels.at("quantile") : ""),
                        s.value);
   }
   EXPECT_THAT(seen, ElementsAre(Pair("Http_Latency@0", 2), Pair("Http_Latency@1", 8),
                                 Pair("Http_Latency_sum", 15), Pair("Http_Latency_count", 3)));
   EXPECT_EQ("gauge", families["Http_Latency_mean"].type);
   EXPECT_EQ(5, families["Http_Latency_mean"].samples.at(0).value);
   // Without samples the extremes and the mean are not numbers.
   ASSERT_EQ(4u, families["Idle"].samples.size());
   EXPECT_TRUE(std::isnan(families["Idle"].samples[0].value));
   EXPECT_EQ(0, families["Idle"].samples[2].value);
   EXPECT_TRUE(std::isnan(families["Idle_mean"].samples.at(0).value));
   EXPECT_EQ(3u, families["Partial"].samples.size());
   EXPECT_EQ(0u, families.count("Partial_mean"));
}

TEST_F(PrometheusTest, ClashingSeriesKeepTheFirstInNameOrder) {
   Add({"/a-b"}, 1);
   Add({"/a_b"}, 2);  // same series as /a-b
   Add({"/a_b_c"}, 3, Metadata::TYPE_COUNTER);
   Add({"/a.b.c"}, 4);  // a_b_c of another type, earlier in order
   MeterAccumulator meter(registry.Get(), "/m");
   meter.Publish();
   meter.Sample(9);
   Add({"/m_sum"}, 5);   // taken by the meter's summary
   Add({"/m_mean"}, 6);  // taken by the meter's mean
   auto families = Parsed();
   ASSERT_EQ(1u, families["a_b"].samples.size());
   EXPECT_EQ(1, families["a_b"].samples[0].value);
   EXPECT_EQ("gauge", families["a_b_c"].type);
   EXPECT_EQ(4, families["a_b_c"].samples.at(0).value);
   EXPECT_EQ(0u, families.count("m_sum"));
   ASSERT_EQ(1u, families["m_mean"].samples.size());
   EXPECT_EQ(9, families["m_mean"].samples[0].value);
}

TEST_F(PrometheusTest, ManyCountersExportAsAValidDocument) {
   for (int i = 0; i < 500; ++i) {
      Add({"/Load/Shard='" + std::to_string(i % 7) + "'/N" + std::to_string(i / 7)}, i,
          (i / 7) % 2 ? Metadata::TYPE_COUNTER : Metadata::TYPE_GAUGE);
   }
   size_t samples = 0;
   for (const auto& [name, family] : Parsed()) samples += family.samples.size();
   EXPECT_EQ(500u, samples);
}

// Runs the scraper's own checker on text; returns its exit code, -1 when it is not installed.
int Promtool(const std::string& text, std::string& report) {
   if (std::system("command -v promtool > /dev/null 2>&1") != 0) return -1;
   char file[] = "/tmp/pelmora_prometheus_XXXXXX";
   int fd = mkostemp(file, O_CLOEXEC);
   bool written = fd >= 0 && write(fd, text.data(), text.size()) == (ssize_t)text.size();
   close(fd);
   FILE* pipe =
       written ? popen(("promtool check metrics < " + std::string(file) + " 2>&1").c_str(), "r")
               : nullptr;
   char buffer[512];
   for (size_t n; pipe && (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;)
      report.append(buffer, n);
   int status = pipe ? pclose(pipe) : -1;
   unlink(file);
   return WIFEXITED(status) ? WEXITSTATUS(status) : -2;
}

TEST_F(PrometheusTest, PromtoolAcceptsTheExport) {
   std::string report, brokenReport;
   if (Promtool("", brokenReport) == -1) GTEST_SKIP() << "promtool is not installed";
   AddMixed();
   Add({"/Edge/Name='a\"b\\c\nd'/Last"}, -1);
   MeterAccumulator latency(registry.Get(), "/Http/Method='GET'/Latency"),
       idle(registry.Get(), "/Idle");
   latency.Publish();
   latency.Sample(7);
   idle.Publish();
   std::string text = Export();
   int code = Promtool(text, report);
   // 0: clean; 3: only naming advice (units, suffixes). 1 would be a parse failure.
   EXPECT_TRUE(code == 0 || code == 3) << "exit " << code << "\n" << report << "\n" << text;
   EXPECT_EQ(std::string::npos, report.find("error")) << report << "\n" << text;
   EXPECT_EQ(std::string::npos, report.find("no help text")) << report;
   // The checker must be able to fail: a broken document is refused.
   EXPECT_EQ(1, Promtool("# TYPE x gauge\nx{a=\"1} 2\n", brokenReport)) << brokenReport;
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
