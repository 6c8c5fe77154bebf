// What the tools print and draw for people: JSON lines of the store, a key's
// history, its SVG chart, and a submitted log as JSON.

#include <libxml/parser.h>
#include <libxml/tree.h>
#include <sys/stat.h>

#include <cstdio>
#include <sstream>

#include "cf/plist.h"
#include "root_fixture.h"

namespace {

std::vector<std::string> Lines(const std::string& text, bool words = false) {
  std::vector<std::string> out;
  std::istringstream in(text);
  for (std::string s; words ? static_cast<bool>(in >> s) : static_cast<bool>(std::getline(in, s));) out.push_back(s);
  return out;
}
std::vector<std::string> Fields(const std::string& line) { return Lines(line, true); }

class ToolOutputTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(platform::WriteRootMarker(root.path(), nullptr)); }
  TempDir root;
  // 2026-11-22 is day 20779.
  std::map<std::string, std::string> env{
      {"TALLYRUN_ROOT", root.path()}, {"TALLYRUN_NOW", "2026-11-22T10:00:00Z"}, {"TZ", "UTC0"}};

  RunResult Tallybook(const std::vector<std::string>& args) { return RunProgram(TALLYBOOK_BIN, args, env); }
  // Sets KEY := VALUE on the day of the instant `when`.
  void SetOn(const std::string& when, const std::string& key, const std::string& value) {
    const std::string saved = env["TALLYRUN_NOW"];
    env["TALLYRUN_NOW"] = when;
    const RunResult r = Tallybook({"set", key, value});
    EXPECT_EQ(r.status, 0) << r.err;
    env["TALLYRUN_NOW"] = saved;
  }
};

TEST_F(ToolOutputTest, DumpJsonLinesMatchTheTextDump) {
  SetOn("2026-11-22T10:00:00Z", "com.velmora.min", "-9223372036854775808");
  SetOn("2026-11-22T10:00:00Z", "com.velmora.\"quoted\\\" é", "42");
  SetOn("2024-02-29T23:59:59Z", "com.velmora.leap", "1");
  SetOn("1970-01-01T00:00:00Z", "com.velmora.epoch", "0");
  for (const char* v : {"0.1", "0.2", "1e300"})
    ASSERT_EQ(Tallybook({"push", "com.velmora.lat", v, "--offset", "5"}).status, 0);
  ASSERT_EQ(Tallybook({"push", "com.velmora.third", "0.30000000000000004", "--offset", "5"}).status, 0);

  const RunResult text = Tallybook({"dump"}), json = Tallybook({"dump", "--json"});
  ASSERT_EQ(text.status, 0) << text.err;
  ASSERT_EQ(json.status, 0) << json.err;
  const auto text_lines = Lines(text.out), json_lines = Lines(json.out);
  ASSERT_EQ(text_lines.size(), 6u) << text.out;
  ASSERT_EQ(json_lines.size(), text_lines.size()) << json.out;
  for (size_t i = 0; i < text_lines.size(); ++i) {
    SCOPED_TRACE(json_lines[i]);
    const cf::ParseResult parsed = cf::ParseJSON(json_lines[i]);
    ASSERT_TRUE(parsed.ok()) << parsed.error;
    const cf::Dictionary& o = *parsed.value.AsDictionary();
    // The key may hold spaces: the text line is "day key... value(s)".
    const std::vector<std::string> f = Fields(text_lines[i]);
    const bool scalar = o.Get("value").AsNumber() != nullptr;
    const size_t tail = scalar ? 1 : 4;
    std::string key;
    for (size_t k = 1; k + tail < f.size(); ++k) key += (k > 1 ? " " : "") + f[k];
    EXPECT_EQ(std::to_string(o.Get("day").AsNumber()->AsSInt64()), f[0]);
    EXPECT_EQ(*o.Get("key").AsString(), key);
    if (scalar) {
      EXPECT_EQ(o.size(), 4u);  // day, date, key, value
      EXPECT_EQ(std::to_string(o.Get("value").AsNumber()->AsSInt64()), f.back());
    } else {
      EXPECT_EQ(o.size(), 7u);
      EXPECT_EQ(std::to_string(o.Get("count").AsNumber()->AsSInt64()), f[f.size() - 4]);
      EXPECT_EQ(o.Get("min").AsNumber()->AsFloat64(), std::stod(f[f.size() - 3]));  // both read back exactly
      EXPECT_EQ(o.Get("max").AsNumber()->AsFloat64(), std::stod(f[f.size() - 2]));  // both read back exactly
      EXPECT_EQ(o.Get("mean").AsNumber()->AsFloat64(), std::stod(f[f.size() - 1]));  // both read back exactly
    }
  }
  // The exact lines: dates of the local day, escaped keys, and reals as the
  // shortest text that reads back (the text dump rounds 0.30000000000000004).
  EXPECT_EQ(json.out,
            "{\"day\":0,\"date\":\"1970-01-01\",\"key\":\"com.velmora.epoch\",\"value\":0}\n"
            "{\"day\":19782,\"date\":\"2024-02-29\",\"key\":\"com.velmora.leap\",\"value\":1}\n"
            "{\"day\":20779,\"date\":\"2026-11-22\",\"key\":\"com.velmora.\\\"quoted\\\\\\\" é\",\"value\":42}\n"
            "{\"day\":20779,\"date\":\"2026-11-22\",\"key\":\"com.velmora.min\",\"value\":-9223372036854775808}\n"
            "{\"day\":20779,\"date\":\"2026-11-22\",\"key\":\"com.velmora.lat\",\"count\":3,\"min\":0.1,\"max\":1e+300,"
            "\"mean\":3.3333333333333335e+299}\n"
            "{\"day\":20779,\"date\":\"2026-11-22\",\"key\":\"com.velmora.third\",\"count\":1,"
            "\"min\":0.30000000000000004,\"max\":0.30000000000000004,\"mean\":0.30000000000000004}\n");
  EXPECT_EQ(Tallybook({"dump", "--json", "--day", "19782"}).out,
            "{\"day\":19782,\"date\":\"2024-02-29\",\"key\":\"com.velmora.leap\",\"value\":1}\n");
  EXPECT_EQ(Tallybook({"dump", "--json", "--prefix", "com.velmora.x"}).out, "");

  // Day numbers and their dates follow the local zone: 10:00 UTC is already
  // the next day fourteen hours east.
  env["TZ"] = "UTC-14";
  ASSERT_EQ(Tallybook({"set", "com.velmora.east", "7"}).status, 0);
  EXPECT_EQ(Tallybook({"dump", "--json", "--prefix", "com.velmora.east"}).out,
            "{\"day\":20780,\"date\":\"2026-11-23\",\"key\":\"com.velmora.east\",\"value\":7}\n");
}

TEST_F(ToolOutputTest, HistoryShowsTheDaysWithValues) {
  const std::string key = "com.velmora.NANDInfo.UserPartitionPEPercentUsed";
  SetOn("2026-11-20T08:00:00Z", key, "5");   // day 20777
  SetOn("2026-11-22T23:59:59Z", key, "7");   // day 20779, today; 20778 has no value
  SetOn("2026-11-23T00:00:00Z", key, "9");   // tomorrow: never shown
  SetOn("2026-10-23T12:00:00Z", key, "1");   // day 20749: 30 days before today
  SetOn("2026-11-21T12:00:00Z", key + "Extra", "100");
  ASSERT_EQ(Tallybook({"push", "com.velmora.lat", "1.5"}).status, 0);

  const struct {
    std::vector<std::string> args;
    std::string out;
  } cases[] = {
      {{"history", key}, "20777 2026-11-20 5\n20779 2026-11-22 7\n"},
      {{"history", key, "--days", "1"}, "20779 2026-11-22 7\n"},
      {{"history", key, "--days", "2"}, "20779 2026-11-22 7\n"},
      {{"history", key, "--days", "3"}, "20777 2026-11-20 5\n20779 2026-11-22 7\n"},
      {{"history", key, "--days", "31"}, "20749 2026-10-23 1\n20777 2026-11-20 5\n20779 2026-11-22 7\n"},
      {{"history", key, "--json", "--days", "3"},
       "{\"day\":20777,\"date\":\"2026-11-20\",\"key\":\"" + key + "\",\"value\":5}\n"
       "{\"day\":20779,\"date\":\"2026-11-22\",\"key\":\"" + key + "\",\"value\":7}\n"},
  };
  for (const auto& c : cases) {
    const RunResult r = Tallybook(c.args);
    EXPECT_EQ(r.status, 0) << c.args.back() << ": " << r.err;
    EXPECT_EQ(r.out, c.out) << c.args.back();
  }

  // Bad input: a message and status 2, nothing on stdout.
  const struct {
    std::vector<std::string> args;
    std::string err;  // empty: any message
  } bad[] = {
      {{"history", "com.velmora.unknown"},
       "tallybook: no values of the scalar key com.velmora.unknown in the last 30 days (2026-10-24 to 2026-11-22)\n"},
      {{"history", "com.velmora.NANDInfo.UserPartition"}, ""},  // a prefix of a key is not that key
      {{"history", "com.velmora.lat"},
       "tallybook: com.velmora.lat is a distribution key; history and plot show scalar keys (see dump for its "
       "samples)\n"},
      {{"history", key + "Extra", "--days", "1"},
       "tallybook: no values of the scalar key " + key + "Extra in the last 1 day (2026-11-22 to 2026-11-22)\n"},
      {{"history", key, "--days", "0"}, "tallybook: --days must be a whole number of days from 1 to 100000: 0\n"},
      {{"history", key, "--days", "100001"},
       "tallybook: --days must be a whole number of days from 1 to 100000: 100001\n"},
      {{"history", key, "--days", "2.5"}, ""},
      {{"history", ""}, "tallybook: key must not be empty\n"},
  };
  for (const auto& c : bad) {
    const RunResult r = Tallybook(c.args);
    const std::string what = c.args[1] + " " + c.args.back();
    EXPECT_EQ(r.status, 2) << what;
    EXPECT_EQ(r.out, "") << what;
    if (c.err.empty()) {
      EXPECT_FALSE(r.err.empty()) << what;
    } else {
      EXPECT_EQ(r.err, c.err) << what;
    }
  }
}

// The elements of an SVG document by name, with their attributes.
struct Element {
  std::string name, text;
  std::map<std::string, std::string> attributes;
  std::string parent_class;
};

void Collect(xmlNode* node, const std::string& parent_class, std::vector<Element>* out) {
  for (xmlNode* n = node; n; n = n->next) {
    if (n->type != XML_ELEMENT_NODE) continue;
    auto take = [](xmlChar* text) {
      std::string s = text ? reinterpret_cast<const char*>(text) : "";
      xmlFree(text);
      return s;
    };
    Element e{reinterpret_cast<const char*>(n->name), take(xmlNodeGetContent(n)), {}, parent_class};
    for (xmlAttr* a = n->properties; a; a = a->next)
      e.attributes[reinterpret_cast<const char*>(a->name)] = take(xmlNodeGetContent(a->children));
    out->push_back(e);
    Collect(n->children, e.attributes.count("class") ? e.attributes["class"] : parent_class, out);
  }
}

std::vector<Element> ParseSvg(const std::string& path, std::string* root_name) {
  std::vector<Element> out;
  xmlDoc* doc = xmlReadFile(path.c_str(), nullptr, XML_PARSE_NONET);
  if (!doc) return out;
  xmlNode* top = xmlDocGetRootElement(doc);
  *root_name = reinterpret_cast<const char*>(top->name);
  Collect(top->children, "", &out);
  xmlFreeDoc(doc);
  return out;
}

std::vector<std::pair<double, double>> Points(const std::string& list) {
  std::vector<std::pair<double, double>> out;
  std::istringstream in(list);
  for (std::string pair; in >> pair;) {
    const size_t comma = pair.find(',');
    out.emplace_back(std::stod(pair.substr(0, comma)), std::stod(pair.substr(comma + 1)));
  }
  return out;
}

TEST_F(ToolOutputTest, PlotDrawsTheStoresPointsWithGaps) {
  const struct {
    std::string key;
    std::vector<std::pair<std::string, std::string>> values;  // instant, value
    std::vector<size_t> segments;                             // points per polyline
    std::vector<std::string> value_labels;                    // empty: not pinned
  } cases[] = {
      // Wear counters grow into the billions: labels in G, with the
      // decimals that tell the ticks apart. 2026-11-21 has no value.
      {"com.velmora.NANDInfo.NumLogicalWrites",
       {{"2026-11-18T10:00:00Z", "12345678901"},
        {"2026-11-19T10:00:00Z", "12350000000"},
        {"2026-11-20T10:00:00Z", "12360000000"},
        {"2026-11-22T10:00:00Z", "12400000000"}},
       {3, 1},
       {"12.34G", "12.36G", "12.38G", "12.40G"}},
      {"com.velmora.NANDInfo.UserPartitionPEPercentUsed",
       {{"2026-11-18T10:00:00Z", "3"}, {"2026-11-20T10:00:00Z", "4"}, {"2026-11-22T10:00:00Z", "4"}},
       {1, 1, 1},
       {"3", "4"}},
      // One day, a negative value, and a title that must be escaped.
      {"com.velmora.<odd> & \"key\"", {{"2026-11-22T10:00:00Z", "-1500"}}, {1}, {"-1,600", "-1,550", "-1,500", "-1,450", "-1,400"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.key);
    for (const auto& [when, value] : c.values) SetOn(when, c.key, value);
    const std::string out = root / "charts/chart.svg";
    const RunResult r = Tallybook({"plot", c.key, "--days", "7", "--out", out});
    ASSERT_EQ(r.status, 0) << r.err;
    struct stat st;
    ASSERT_EQ(stat(out.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    std::string root_name;
    const std::vector<Element> svg = ParseSvg(out, &root_name);
    ASSERT_EQ(root_name, "svg");
    std::vector<std::pair<std::string, std::string>> drawn;  // data-day, data-value
    std::vector<std::pair<double, double>> centres;
    std::vector<std::vector<std::pair<double, double>>> lines;
    std::vector<std::string> labels;
    bool titled = false;
    for (const Element& e : svg) {
      const auto at = [&](const char* name) {
        const auto it = e.attributes.find(name);
        return it == e.attributes.end() ? std::string() : it->second;
      };
      if (e.name == "circle") {
        drawn.emplace_back(at("data-day"), at("data-value"));
        centres.emplace_back(std::stod(at("cx")), std::stod(at("cy")));
      }
      if (e.name == "polyline" && e.parent_class == "series") lines.push_back(Points(at("points")));
      if (e.name == "text" && e.parent_class == "value-ticks") labels.push_back(e.text);
      if (e.name == "text" && at("class") == "title") titled = e.text == c.key;
    }
    EXPECT_TRUE(titled);

    // The points are exactly the store's values, in day order.
    std::vector<std::pair<std::string, std::string>> stored;
    for (const std::string& line : Lines(Tallybook({"history", c.key, "--days", "7"}).out)) {
      const auto f = Fields(line);
      stored.emplace_back(f[0], f[2]);
    }
    EXPECT_EQ(drawn, stored);
    ASSERT_EQ(stored.size(), c.values.size());

    // One polyline per run of consecutive days, through the circles' centres.
    std::vector<size_t> sizes;
    std::vector<std::pair<double, double>> joined;
    for (const auto& l : lines) {
      sizes.push_back(l.size());
      joined.insert(joined.end(), l.begin(), l.end());
    }
    EXPECT_EQ(sizes, c.segments);
    EXPECT_EQ(joined, centres);
    // Later days further right, larger values higher up.
    for (size_t i = 1; i < centres.size(); ++i) {
      EXPECT_GT(centres[i].first, centres[i - 1].first);
      const int64_t a = std::stoll(stored[i - 1].second), b = std::stoll(stored[i].second);
      if (b > a) {
        EXPECT_LT(centres[i].second, centres[i - 1].second);
      } else if (b == a) {
        EXPECT_EQ(centres[i].second, centres[i - 1].second);
      }
    }
    EXPECT_EQ(labels, c.value_labels);
    ASSERT_TRUE(std::filesystem::remove(out));
  }

  // Nothing to draw, or nowhere to draw it: status 2, and no file.
  ASSERT_EQ(Tallybook({"push", "com.velmora.lat", "1"}).status, 0);
  const std::string out = root / "none.svg";
  for (const auto& args : std::vector<std::vector<std::string>>{
           {"plot", "com.velmora.unknown", "--out", out},
           {"plot", "com.velmora.lat", "--out", out},
           {"plot", "com.velmora.NANDInfo.NumLogicalWrites", "--days", "0", "--out", out},
           {"plot", "com.velmora.NANDInfo.NumLogicalWrites", "--out", root / "dir/"},
           {"plot", "com.velmora.NANDInfo.NumLogicalWrites"},
       }) {
    const RunResult r = Tallybook(args);
    EXPECT_EQ(r.status, 2) << args[1];
    EXPECT_FALSE(r.err.empty()) << args[1];
  }
  EXPECT_FALSE(platform::FileExists(out));
  EXPECT_FALSE(platform::FileExists(root / "dir"));

  // A link planted where the chart goes below the root is refused.
  ASSERT_EQ(symlink("/tmp/elsewhere.svg", (root / "linked.svg").c_str()), 0);
  const RunResult r = Tallybook({"plot", "com.velmora.NANDInfo.NumLogicalWrites", "--out", root / "linked.svg"});
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.err.find("linked.svg"), std::string::npos) << r.err;
  EXPECT_FALSE(platform::FileExists("/tmp/elsewhere.svg"));
}

class ShowTest : public RootTest {};

TEST_F(ShowTest, ShowsASubmittedLogAsJson) {
  const RunResult run = Tallyrun({"-f"});
  ASSERT_EQ(run.status, 0) << run.err;
  const auto logs = Logs();
  ASSERT_FALSE(logs.empty());
  const RunResult shown = Tallyctl({"show", logs.back()});
  ASSERT_EQ(shown.status, 0) << shown.err;
  const cf::ParseResult parsed = cf::ParseJSON(shown.out);
  ASSERT_TRUE(parsed.ok()) << parsed.error;
  const cf::Value log = ReadPlist(logs.back());
  ASSERT_TRUE(log.AsDictionary() && parsed.value.AsDictionary());
  std::vector<std::string> want, got;
  for (const auto& [k, v] : *log.AsDictionary()) {
    want.push_back(*k.AsString());
    // Text and integers come through as they are.
    const cf::Value shown_value = parsed.value.AsDictionary()->Get(k);
    if (v.AsString() || (v.AsNumber() && !v.AsNumber()->IsFloat())) {
      EXPECT_EQ(shown_value, v) << *k.AsString();
    }
  }
  for (const auto& [k, v] : *parsed.value.AsDictionary()) got.push_back(*k.AsString());
  std::sort(want.begin(), want.end());
  std::sort(got.begin(), got.end());
  EXPECT_GT(want.size(), 3u);
  EXPECT_EQ(got, want);

  // The exact text of every kind of value.
  cf::Dictionary d;
  d.Set("when", cf::Date{1795341600.0});
  d.Set("blob", cf::Value::Bytes(cf::Data{'h', 'i', '!'}));
  d.Set("ratio", cf::Value::Float64(0.1 + 0.2));
  d.Set("whole", cf::Value::Float64(2));
  d.Set("n", cf::Value::SInt64(-3));
  cf::Array list;
  list.Append(cf::Value::Bool(true));
  list.Append(cf::Value("tab\there"));
  d.Set("list", list);
  d.Set("empty", cf::Dictionary());
  d.Set("none", cf::Array());
  WritePlist("kinds.plist", d);
  const RunResult kinds = Tallyctl({"show", root / "kinds.plist"});
  EXPECT_EQ(kinds.status, 0) << kinds.err;
  EXPECT_EQ(kinds.out,
            "{\n"
            "  \"when\": \"2026-11-22T10:00:00Z\",\n"
            "  \"blob\": \"aGkh\",\n"
            "  \"ratio\": 0.30000000000000004,\n"
            "  \"whole\": 2,\n"
            "  \"n\": -3,\n"
            "  \"list\": [\n"
            "    true,\n"
            "    \"tab\\there\"\n"
            "  ],\n"
            "  \"empty\": {},\n"
            "  \"none\": []\n"
            "}\n");

  // Not a property list: a message naming the file, status 2.
  ASSERT_TRUE(platform::WriteFileAtomically(root / "notes.txt", "plain text, not a property list\n"));
  ASSERT_TRUE(platform::WriteFileAtomically(root / "empty.plist", ""));
  ASSERT_TRUE(platform::WriteFileAtomically(root / "cut.plist", "<?xml version=\"1.0\"?><plist><dict><key>a</key>"));
  for (const std::string& file : {root / "notes.txt", root / "empty.plist", root / "cut.plist", root / "missing.plist",
                                   root / "var"}) {
    const RunResult r = Tallyctl({"show", file});
    EXPECT_EQ(r.status, 2) << file;
    EXPECT_EQ(r.out, "") << file;
    EXPECT_EQ(r.err.rfind("tallyctl: ", 0), 0u) << r.err;
    EXPECT_NE(r.err.find(file), std::string::npos) << r.err;
  }
  EXPECT_EQ(Tallyctl({"show", root / "empty.plist"}).err,
            "tallyctl: " + (root / "empty.plist") + " is not a property list: empty property list\n");
}

}  // namespace
