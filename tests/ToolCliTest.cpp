// The offsetops program as a person or a script meets it: --version, help and
// suggestions; the output formats (JSON read back by a small parser of the
// test's own); record --skip and the resume wording; a closed pipe; SIGINT
// and SIGTERM to record, export and backup; the man page and the bash
// completion against the command table.

#include <gtest/gtest.h>

#ifndef TARN_HAVE_TOOLS

TEST(ToolCliTest, NeedsTheTools) {
    GTEST_SKIP() << "configure with -DTARN_BUILD_TOOLS=ON to build and test offsetops";
}

#else

#include <fcntl.h>
#include <gmock/gmock.h>
#include <spawn.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <memory>
#include <sstream>

#include "tests/ToolSupport.h"
#include "tools/CommandTable.h"

extern char** environ;

namespace tarn::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::StartsWith;

const std::string kSite = "00000000-0000-4000-8000-00000000000a";

// ---------------------------------------------------------------------------
// A JSON value and a strict parser of the test's own: what the program
// writes must be one document that parses, with nothing after it.

struct Json {
    enum class Type { Null, Bool, Number, String, Array, Object } type = Type::Null;
    bool boolean = false;
    std::string text;  // a number's digits, a string's value
    std::vector<Json> items;
    std::vector<std::pair<std::string, Json> > members;

    const Json& operator[](const std::string& key) const {
        for (const auto& [k, v] : members) {
            if (k == key) {
                return v;
            }
        }
        throw std::runtime_error("no member '" + key + "'");
    }
    int64 Int() const { return std::stoll(text); }
};

class JsonParser {
public:
    explicit JsonParser(const std::string& text) : m_text(text) {}

    Json Document() {
        Json value = Value();
        Blanks();
        if (m_at != m_text.size()) {
            Fail("text after the document");
        }
        return value;
    }

private:
    [[noreturn]] void Fail(const std::string& what) {
        throw std::runtime_error("JSON at byte " + std::to_string(m_at) + ": " + what);
    }
    void Blanks() {
        while (m_at < m_text.size() && std::strchr(" \t\r\n", m_text[m_at]) != nullptr) {
            ++m_at;
        }
    }
    bool Take(char c) {
        Blanks();
        if (m_at < m_text.size() && m_text[m_at] == c) {
            ++m_at;
            return true;
        }
        return false;
    }
    void Expect(char c) {
        if (!Take(c)) {
            Fail(std::string("expected '") + c + "'");
        }
    }
    std::string String() {
        Expect('"');
        std::string s;
        while (m_at < m_text.size() && m_text[m_at] != '"') {
            const char c = m_text[m_at++];
            if (static_cast<unsigned char>(c) < 0x20) {
                Fail("a control character in a string");
            }
            if (c != '\\') {
                s += c;
                continue;
            }
            const char e = m_text.at(m_at++);
            const char* simple = "\"\\/bfnrt";
            const char* meant = "\"\\/\b\f\n\r\t";
            if (const char* p = std::strchr(simple, e); p != nullptr && e != '\0') {
                s += meant[p - simple];
            } else if (e == 'u') {
                const unsigned code = std::stoul(m_text.substr(m_at, 4), nullptr, 16);
                m_at += 4;
                s += code < 0x80 ? std::string(1, static_cast<char>(code)) : "\xEF\xBF\xBD";
            } else {
                Fail("a bad escape");
            }
        }
        Expect('"');
        return s;
    }
    Json Value() {
        Blanks();
        Json v;
        if (m_at >= m_text.size()) {
            Fail("the document ends early");
        }
        const char c = m_text[m_at];
        if (c == '{') {
            v.type = Json::Type::Object;
            ++m_at;
            if (!Take('}')) {
                do {
                    Blanks();
                    std::string key = String();
                    Expect(':');
                    v.members.emplace_back(std::move(key), Value());
                } while (Take(','));
                Expect('}');
            }
        } else if (c == '[') {
            v.type = Json::Type::Array;
            ++m_at;
            if (!Take(']')) {
                do {
                    v.items.push_back(Value());
                } while (Take(','));
                Expect(']');
            }
        } else if (c == '"') {
            v.type = Json::Type::String;
            v.text = String();
        } else if (m_text.compare(m_at, 4, "true") == 0 || m_text.compare(m_at, 5, "false") == 0) {
            v.type = Json::Type::Bool;
            v.boolean = c == 't';
            m_at += v.boolean ? 4 : 5;
        } else if (c == '-' || std::isdigit(static_cast<unsigned char>(c))) {
            v.type = Json::Type::Number;
            const std::size_t start = m_at;
            m_at += c == '-' ? 1 : 0;
            while (m_at < m_text.size() && std::isdigit(static_cast<unsigned char>(m_text[m_at]))) {
                ++m_at;
            }
            v.text = m_text.substr(start, m_at - start);
            if (v.text == "-" || (v.text.size() > 1 && v.text[v.text[0] == '-'] == '0')) {
                Fail("a malformed number");
            }
        } else {
            Fail("no value");
        }
        return v;
    }

    const std::string& m_text;
    std::size_t m_at = 0;
};

Json ParseJson(const std::string& text) {
    return JsonParser(text).Document();
}

// The tables of a `show --format json` document, as the model holds them.
Model ModelOfJson(const Json& doc) {
    Model model;
    EXPECT_EQ(doc.type, Json::Type::Array);
    for (const Json& field : doc.items) {
        const FieldId key = *ParseFieldId(field["field"].text);
        EXPECT_EQ(field["oid"].text, std::to_string(key.oid.value_));
        EXPECT_EQ("#" + field["oid"].text + "/" + field["path"].text, ToString(key));
        for (const Json& record : field["table"].items) {
            SiteOffset<int64>& so = model[key][*ParseGuid(record["site"].text)];
            so.t = record["t"].Int();
            so.o = record["o"].Int();
        }
    }
    return model;
}

// ---------------------------------------------------------------------------

TEST(ToolCommandLine, VersionHelpAndSuggestionsForNearMisses) {
    EXPECT_EQ(RunOk({"--version"}), std::string("offsetops ") + OFFSETOPS_VERSION + "\n");
    const std::string help = RunOk({"help"});
    EXPECT_EQ(RunOk({"--help"}), help);
    for (const tool::CommandDecl& command : tool::Commands()) {
        EXPECT_THAT(help, HasSubstr("\n  " + command.name + " ")) << command.name;
        const std::string commandHelp = RunOk({"help", command.name});
        EXPECT_THAT(commandHelp, StartsWith("Usage: offsetops " + command.name + " "));
        EXPECT_EQ(RunOk({command.name, "--help"}), commandHelp);
        for (const tool::OptionDecl& option : command.options) {
            EXPECT_THAT(commandHelp, HasSubstr("\n  " + option.name + " ")) << option.name;
        }
    }
    // What is wrong, a suggestion when a name is near one, status 2.
    const std::vector<std::pair<std::vector<std::string>, std::string> > wrong = {
        {{"shwo"}, "unknown command 'shwo': did you mean 'show'? (see 'offsetops --help')"},
        {{"valdiate"}, "unknown command 'valdiate': did you mean 'validate'?"},
        {{"frobnicate"},
         "unknown command 'frobnicate': use record, show, export, diff, backup, "
         "sites, merge, compact, dump, validate, stats or clear (see 'offsetops --help')"},
        {{"help", "stast"}, "unknown command 'stast': did you mean 'stats'?"},
        {{"show", "--store", "s", "--limt", "3"},
         "unknown option '--limt' for show: did you mean '--limit'? (see 'offsetops show "
         "--help')"},
        {{"record", "--store", "s", "--comit-every", "3"}, "did you mean '--commit-every'?"},
        {{"export", "--store", "s", "--bogus"},
         "unknown option '--bogus' for export (see 'offsetops export --help')"},
        {{"show", "--store", "s", "--format", "jsno"},
         "--format must be text, json or csv, got 'jsno': did you mean 'json'?"},
        {{"--version", "extra"}, "unexpected argument 'extra' after --version"},
        {{"record", "--store", "s", "--generate", "5", "--skip", "3"},
         "--skip goes with --ops: it skips lines of the file"},
        {{"stats", "--store", "s", "--no-sync=1"}, "unknown option '--no-sync' for stats"},
        {{"record", "--store", "s", "--ops", "f", "--no-sync=1"},
         "--no-sync is a flag and takes no value"},
    };
    for (const auto& [args, message] : wrong) {
        const ToolRun run = Tool(args);
        EXPECT_EQ(run.status, 2) << ::testing::PrintToString(args);
        EXPECT_EQ(run.out, "");
        EXPECT_THAT(run.err, OneLineWith(message)) << ::testing::PrintToString(args);
    }
}

// The same store in each format: JSON read back gives the model, CSV a row
// per site record, and every document is one whole one.
TEST(ToolFormats, ShowStatsDiffValidateAndSitesInTextJsonAndCsv) {
    ScratchDir dir;
    const std::string a = dir.Sub("a"), b = dir.Sub("b");
    const std::string ops = Generated({2000, 300, 3, 5});
    const Model model = ModelOf(ops);
    RunOk({"record", "--store", a, "--ops", dir.Write("a.ops", ops)});

    EXPECT_EQ(ModelOfJson(ParseJson(RunOk({"show", "--store", a, "--format", "json"}))), model);
    const auto& [someField, someSites] = *std::next(model.begin(), 40);
    EXPECT_EQ(ModelOfJson(ParseJson(RunOk(
                  {"show", "--store", a, "--field", ToString(someField), "--format", "json"}))),
              Model({{someField, someSites}}));
    const Json limited =
        ParseJson(RunOk({"show", "--store", a, "--limit", "7", "--format", "json"}));
    EXPECT_EQ(limited.items.size(), 7u);
    EXPECT_EQ(
        ParseJson(RunOk({"show", "--store", a, "--limit", "0", "--format", "json"})).items.size(),
        0u);

    std::string csv;
    for (const auto& [field, sites] : model) {
        for (const auto& [site, so] : sites) {
            csv += ToString(field) + "," + ToString(site) + "," + std::to_string(so.t) + "," +
                   std::to_string(so.o) + "\n";
        }
    }
    EXPECT_EQ(RunOk({"show", "--store", a, "--format", "csv"}), "field,site,t,o\n" + csv);

    const Json stats = ParseJson(RunOk({"stats", "--store", a, "--format", "json"}));
    EXPECT_EQ(stats["fields"].Int(), static_cast<int64>(model.size()));
    EXPECT_EQ(stats["nodes"].Int(), stats["leaves"].Int() + stats["internal_nodes"].Int());
    EXPECT_EQ(stats["ops_since_checkpoint"].Int(), 0);
    EXPECT_THAT(RunOk({"stats", "--store", a, "--format", "csv"}),
                HasSubstr("\nfields," + std::to_string(model.size()) + "\n"));

    const Json valid = ParseJson(RunOk({"validate", "--store", a, "--format", "json"}));
    EXPECT_TRUE(valid["valid"].boolean);
    EXPECT_EQ(valid["fields"].Int(), static_cast<int64>(model.size()));
    EXPECT_TRUE(valid["problems"].items.empty());
    EXPECT_THAT(RunOk({"validate", "--store", a, "--format", "csv"}),
                StartsWith("name,value\nvalid,true\n"));

    std::map<Guid, int64> newest;
    for (const auto& [field, sites] : model) {
        for (const auto& [site, so] : sites) {
            newest[site] = std::max(newest[site], so.t);
        }
    }
    const Json sites = ParseJson(RunOk({"sites", "--store", a, "--format", "json"}));
    ASSERT_EQ(sites.items.size(), newest.size());
    std::string sitesCsv = "site,t\n";
    auto it = newest.begin();
    for (const Json& site : sites.items) {
        EXPECT_EQ(site["site"].text, ToString(it->first));
        EXPECT_EQ(site["t"].Int(), it->second);
        sitesCsv += ToString(it->first) + "," + std::to_string(it->second) + "\n";
        ++it;
    }
    EXPECT_EQ(RunOk({"sites", "--store", a, "--format", "csv"}), sitesCsv);

    // b: one field less, one more, one changed.
    const FieldId removed = model.begin()->first;
    Model other = model;
    other.erase(removed);
    std::string exported;
    for (const auto& [field, sites2] : other) {
        for (const auto& [site, so] : sites2) {
            exported += tool::FormatOpsLine({site, so.t, field, so.o}) + "\n";
        }
    }
    const FieldId added(OID(Seid(uint64{999999})), Path());
    const FieldId changed = std::next(model.begin(), 2)->first;
    const Guid changer = std::next(model.begin(), 2)->second.begin()->first;
    exported += tool::FormatOpsLine({tool::Generator::SiteGuid(1), 7, added, 3}) + "\n";
    exported += tool::FormatOpsLine({changer, 4294967295, changed, 1}) + "\n";
    RunOk({"record", "--store", b, "--ops", dir.Write("b.ops", exported)});
    const ToolRun diff = Tool({"diff", "--store", a, "--with", b, "--format", "json"});
    EXPECT_EQ(diff.status, 1) << diff.err;
    const Json changes = ParseJson(diff.out);
    ASSERT_EQ(changes.items.size(), 3u) << diff.out;
    EXPECT_EQ(changes.items[0]["change"].text, "only-a");
    EXPECT_EQ(changes.items[0]["field"].text, ToString(removed));
    EXPECT_EQ(changes.items[0]["a"].items.size(), model.begin()->second.size());
    EXPECT_EQ(changes.items[1]["change"].text, "other");
    EXPECT_EQ(changes.items[1]["field"].text, ToString(changed));
    EXPECT_EQ(changes.items[1]["a"].items.size(), changes.items[1]["b"].items.size());
    EXPECT_EQ(changes.items[2]["change"].text, "only-b");
    EXPECT_EQ(changes.items[2]["field"].text, ToString(added));
    EXPECT_EQ(changes.items[2]["b"].items[0]["t"].Int(), 7);
    const ToolRun diffCsv = Tool({"diff", "--store", a, "--with", b, "--format", "csv"});
    EXPECT_EQ(diffCsv.status, 1);
    EXPECT_THAT(diffCsv.out,
                StartsWith("change,field,store,site,t,o\nonly-a," + ToString(removed) + ",a,"));
    EXPECT_THAT(diffCsv.out, HasSubstr("\nonly-b," + ToString(added) + ",b," +
                                       ToString(tool::Generator::SiteGuid(1)) + ",7,3\n"));
    const ToolRun same = Tool({"diff", "--store", a, "--with", a, "--format", "json"});
    EXPECT_EQ(same.status, 0);
    EXPECT_TRUE(ParseJson(same.out).items.empty());
}

// The output layer: a summary and a listing in each format, with text that
// JSON must escape (quotes, control characters, bytes that are not UTF-8)
// and CSV must quote; a JSON element a line.
TEST(ToolFormats, ReportsEscapeQuoteAndLayOutEachFormat) {
    const std::string tricky = std::string("a\"b\\c\nd\te\x01") + "f\xff" + "\xc3\xa9";
    tool::Summary summary;
    summary.Value("count", int64{-9223372036854775807 - 1}, "count")
        .Value("name", tricky)
        .TextRow("name", "tricky")
        .List("problems", "problem", "problem: ", {"x,\"y\"", "z"})
        .TextLine("valid");
    std::ostringstream json;
    summary.Write(json, tool::Format::Json);
    const std::string document = json.str();
    const Json doc = ParseJson(document);
    EXPECT_EQ(doc["count"].text, "-9223372036854775808");
    EXPECT_EQ(doc["name"].text, std::string("a\"b\\c\nd\te\x01") + "f\xEF\xBF\xBD" + "\xc3\xa9");
    EXPECT_EQ(doc["problems"].items.size(), 2u);
    EXPECT_EQ(std::count(document.begin(), document.end(), '\n'), 5);  // {, 3 members, }
    std::ostringstream csv;
    summary.Write(csv, tool::Format::Csv);
    EXPECT_EQ(csv.str(), "name,value\ncount,-9223372036854775808\nname,\"" +
                             std::string("a\"\"b\\c\nd\te\x01") +
                             "f\xff\xc3\xa9\"\nproblem,\"x,\"\"y\"\"\"\nproblem,z\n");
    std::ostringstream text;
    summary.Write(text, tool::Format::Text);
    EXPECT_THAT(text.str(), MatchesRegex("count +-9223372036854775808\nname +tricky\n"
                                         "problem: x,\"y\"\nproblem: z\nvalid\n"));

    for (const tool::Format format : {tool::Format::Text, tool::Format::Json, tool::Format::Csv}) {
        std::ostringstream out;
        tool::Listing listing(out, format, "site,t");
        listing.Item(tool::Json{{"site", "s,1"}, {"t", 5}});
        listing.Item(tool::Json{{"site", "s2"}, {"t", 6}});
        listing.End("note");
        const std::string expected[] = {
            "s,1 5\ns2 6\n(note)\n",
            "[\n{\"site\":\"s,1\",\"t\":5},\n{\"site\":\"s2\",\"t\":6}\n]\n",
            "site,t\n\"s,1\",5\ns2,6\n"};
        EXPECT_EQ(out.str(), expected[static_cast<int>(format)]);
    }
    std::ostringstream empty;
    tool::Listing(empty, tool::Format::Json, "").End();
    EXPECT_EQ(empty.str(), "[]\n");
}

// JSON strings byte for byte as the program has always written them: every
// control character escaped (\b and \f too, as \u forms), well-formed UTF-8
// as it is, and one \ufffd for each byte that starts no well-formed sequence
// (a cut-off sequence, an overlong form, a surrogate, past U+10FFFF). CSV
// quotes a carriage return as it does a line feed.
TEST(ToolFormats, JsonAndCsvQuoteEveryByteAsTheyAlwaysHave) {
    for (int c = 0; c < 0x80; ++c) {
        const std::string byte(1, static_cast<char>(c));
        const std::string quoted = tool::JsonQuoted(byte);
        EXPECT_EQ(ParseJson(quoted).text, byte) << "byte " << c << ": " << quoted;
        EXPECT_EQ(quoted.size() == 3, c >= 0x20 && c < 0x7F && c != '"' && c != '\\') << c;
    }
    for (int c = 0x80; c < 0x100; ++c) {
        EXPECT_EQ(tool::JsonQuoted(std::string(1, static_cast<char>(c))), "\"\\ufffd\"") << c;
    }
    const std::pair<std::string, std::string> cases[] = {
        {"\b\f\x01\x1f\x7f", R"("\u0008\u000c\u0001\u001f\u007f")"},
        {"\"\\/\r\n\t", R"("\"\\/\r\n\t")"},
        {"\xc3\xa9\xe2\x82\xac\xf0\x9f\x98\x80\xef\xbf\xbd",
         "\"\xc3\xa9\xe2\x82\xac\xf0\x9f\x98\x80\xef\xbf\xbd\""},
        {"\xe2\x82!", R"("\ufffd\ufffd!")"},
        {"\xc0\x80", R"("\ufffd\ufffd")"},
        {"\xe0\x80\x80", R"("\ufffd\ufffd\ufffd")"},
        {"\xed\xa0\x80", R"("\ufffd\ufffd\ufffd")"},
        {"\xf4\x90\x80\x80", R"("\ufffd\ufffd\ufffd\ufffd")"},
        {"x\xc3", R"("x\ufffd")"},
    };
    for (const auto& [text, quoted] : cases) {
        EXPECT_EQ(tool::JsonQuoted(text), quoted);
    }
    const tool::Json nested{{"a\x01", tool::Json::array({1, -2, true, nullptr, "\xff"})},
                            {"b", tool::Json::object()},
                            {"u", UINT64_MAX}};
    EXPECT_EQ(tool::JsonText(nested),
              R"({"a\u0001":[1,-2,true,null,"\ufffd"],"b":{},"u":18446744073709551615})");

    EXPECT_EQ(tool::CsvField("a\rb"), "\"a\rb\"");
    EXPECT_EQ(tool::CsvField("\""), "\"\"\"\"");
    EXPECT_EQ(tool::CsvField("a b\t\\"), "a b\t\\");
}

// ---------------------------------------------------------------------------

// A refused line names the --skip that goes on after it once it is fixed;
// that run takes the rest, and the store ends as if the file had been right.
TEST(ToolResume, RecordSkipGoesOnWhereARefusalSaid) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    std::vector<std::string> lines = {"# header",        kSite + ",1,5,,1", "",
                                      kSite + ",2,5,,1", "# note",          kSite + ",3,6,01,2"};
    const std::string bad = kSite + ",3,6,0,2";  // an odd path
    std::vector<std::string> rest = {kSite + ",4,7,,3", "# end", kSite + ",5,5,,-1"};
    auto text = [](const std::vector<std::string>& ls) {
        std::string t;
        for (const std::string& l : ls) {
            t += l + "\n";
        }
        return t;
    };
    const std::string file = dir.Write("ops.txt", text(lines) + bad + "\n" + text(rest));
    const ToolRun refused =
        Tool({"record", "--store", store, "--ops", file, "--commit-every", "2"});
    EXPECT_EQ(refused.status, 1);
    EXPECT_THAT(refused.err,
                OneLineWith("ops.txt:7: path '0' has an odd number of hex digits; stopped there: "
                            "the 3 operations of this run before it are durable, nothing from it "
                            "on; to go on after fixing it: offsetops record --store " +
                            store + " --ops " + file + " --skip 6"));
    dir.Write("ops.txt", text(lines) + kSite + ",3,6,02,2\n" + text(rest));
    const std::string out = RunOk({"record", "--store", store, "--ops", file, "--skip", "6"});
    EXPECT_EQ(RowValue(out, "operations"), "3");
    EXPECT_EQ(Shown(store), ShowText(ModelOf(text(lines) + kSite + ",3,6,02,2\n" + text(rest))));

    // Standard input goes on the same way; a skip past the end is an error
    // that records nothing.
    const ToolRun piped =
        Tool({"record", "--store", dir.Sub("piped"), "--ops", "-"}, kSite + ",1,1,,1\nx\n");
    EXPECT_THAT(piped.err, HasSubstr("; to go on after fixing it: offsetops record --store " +
                                     dir.Sub("piped") + " --ops - --skip 1"));
    const ToolRun past =
        Tool({"record", "--store", dir.Sub("past"), "--ops", file, "--skip", "99"});
    EXPECT_EQ(past.status, 1);
    EXPECT_THAT(past.err, OneLineWith("--skip 99 passes the end of ops file '" + file +
                                      "', which has 10 lines"));
    EXPECT_FALSE(fs::exists(dir.Sub("past")));
    // Paths that need quoting are quoted in the hint.
    const std::string odd = dir.Sub("a store");
    const ToolRun quoted = Tool({"record", "--store", odd, "--ops", "-"}, "x\n");
    EXPECT_THAT(quoted.err, HasSubstr("--store '" + odd + "' --ops -"));
}

// A reader that stops reading ends the program quietly.
TEST(ToolPipes, AClosedPipeEndsTheProgramQuietly) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    RunOk({"record", "--store", store, "--generate", "20000", "--fields", "20000", "--no-sync"});
    for (const std::string& command :
         {std::string("show --store ") + store, "show --store " + store + " --format json",
          "export --store " + store, "dump --store " + store}) {
        const std::string script = std::string(OFFSETOPS_PATH) + " " + command + " 2>" +
                                   dir.Sub("err") + " | head -1 >" + dir.Sub("first") +
                                   "; echo ${PIPESTATUS[0]} >" + dir.Sub("status");
        ASSERT_EQ(std::system(("bash -c '" + script + "'").c_str()), 0);
        const std::string status = ReadFile(dir.Sub("status"));
        EXPECT_TRUE(status == "0\n" || status == "141\n") << command << ": " << status;
        EXPECT_EQ(ReadFile(dir.Sub("err")), "") << command;
        EXPECT_NE(ReadFile(dir.Sub("first")), "") << command;
    }
}

// ---------------------------------------------------------------------------

// offsetops in a child process of its own, its standard input a pipe the
// test writes, its output in files.
class Child {
public:
    explicit Child(const std::vector<std::string>& args) {
        int fds[2];
        EXPECT_EQ(::pipe(fds), 0);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, fds[0], 0);
        posix_spawn_file_actions_addclose(&actions, fds[1]);
        posix_spawn_file_actions_addopen(&actions, 1, m_io.Sub("out").c_str(),
                                         O_WRONLY | O_CREAT | O_TRUNC, 0644);
        posix_spawn_file_actions_addopen(&actions, 2, m_io.Sub("err").c_str(),
                                         O_WRONLY | O_CREAT | O_TRUNC, 0644);
        std::vector<std::string> all = {OFFSETOPS_PATH};
        all.insert(all.end(), args.begin(), args.end());
        std::vector<char*> argv;
        for (std::string& a : all) {
            argv.push_back(a.data());
        }
        argv.push_back(nullptr);
        EXPECT_EQ(::posix_spawn(&m_pid, OFFSETOPS_PATH, &actions, nullptr, argv.data(), environ),
                  0);
        posix_spawn_file_actions_destroy(&actions);
        ::close(fds[0]);
        m_input = fds[1];
    }
    ~Child() {
        if (m_input >= 0) {
            ::close(m_input);
        }
        if (m_pid > 0) {
            ::kill(m_pid, SIGKILL);
            ::waitpid(m_pid, nullptr, 0);
        }
    }

    pid_t Pid() const { return m_pid; }
    void Write(const std::string& text) {
        EXPECT_EQ(::write(m_input, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    void Signal(int signal) { EXPECT_EQ(::kill(m_pid, signal), 0); }
    // Waits for the child's end, its input still open.
    ToolRun Wait() {
        int status = 0;
        EXPECT_EQ(::waitpid(m_pid, &status, 0), m_pid);
        m_pid = -1;
        return Result(status, m_io);
    }

private:
    ScratchDir m_io;
    pid_t m_pid = -1;
    int m_input = -1;
};

// Polls `condition` until it holds (or fails the test after a long while: a
// bound on a hang, not a time the program must meet).
void Await(const std::function<bool()>& condition, const std::string& what) {
    for (int i = 0; i < 120000 && !condition(); ++i) {
        ::usleep(1000);
    }
    ASSERT_TRUE(condition()) << "never: " << what;
}

// The durable operations a reader of `store` sees (0 before it exists).
int64 DurableOperations(const std::string& store) {
    if (!fs::exists(store + "/journal")) {
        return 0;
    }
    const ToolRun run = Tool({"stats", "--store", store, "--format", "csv"});
    std::istringstream rows(run.out);
    int64 since = 0;
    for (std::string row; std::getline(rows, row);) {
        if (row.starts_with("ops_since_checkpoint,")) {
            since = std::stoll(row.substr(21));
        }
    }
    return since;
}

// `child` stopped (SIGSTOP) at a moment when `partial` exists, that is with
// its work begun and not finished; then `signal` and SIGCONT, so that the
// signal is there as it runs on.
void SignalWhileExists(Child& child, const std::string& partial, int signal) {
    Await(
        [&] {
            child.Signal(SIGSTOP);
            if (fs::exists(partial)) {
                return true;
            }
            child.Signal(SIGCONT);
            return false;
        },
        partial + " made");
    child.Signal(signal);
    child.Signal(SIGCONT);
}

// SIGINT to a record waiting for input: it stops at a durable point with
// what it took, prints its summary and how to go on, and exits 130; going on
// as it says gives the whole file. SIGTERM to a generating record: 143, and
// the store holds exactly the operations its summary counts.
TEST(ToolSignals, RecordStopsAtADurablePointAndSaysHowToGoOn) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    const std::string ops = Generated({600, 50, 2, 3});
    // The first 300 lines, their operations, and the line of the last one.
    std::string firstPart;
    int64 firstOps = 0, lastOpLine = 0;
    std::istringstream in(ops);
    std::string line;
    for (int64 n = 1; n <= 300 && std::getline(in, line); ++n) {
        firstPart += line + "\n";
        if (!line.empty() && line[0] != '#') {
            ++firstOps;
            lastOpLine = n;
        }
    }
    {
        Child child({"record", "--store", store, "--ops", "-", "--commit-every", "1"});
        child.Write(firstPart);
        Await([&] { return DurableOperations(store) == firstOps; }, "the first part durable");
        child.Signal(SIGINT);
        const ToolRun run = child.Wait();
        EXPECT_EQ(run.status, 130) << run.err;
        EXPECT_EQ(RowValue(run.out, "operations"), std::to_string(firstOps));
        EXPECT_THAT(
            run.err,
            OneLineWith("stopped by SIGINT at a durable point: the " + std::to_string(firstOps) +
                        " operations of this run are durable; to go on: offsetops record "
                        "--store " +
                        store + " --ops - --skip " + std::to_string(lastOpLine)));
    }
    EXPECT_EQ(Shown(store), ShowText(ModelOf(firstPart)));
    RunOk({"record", "--store", store, "--ops", "-", "--skip", std::to_string(lastOpLine)}, ops);
    EXPECT_EQ(Shown(store), ShowText(ModelOf(ops)));
    RunOk({"validate", "--store", store});

    const std::string generated = dir.Sub("generated");
    Child child({"record", "--store", generated, "--generate", "1000000000", "--fields", "500",
                 "--sites", "3", "--commit-every", "100", "--no-sync"});
    Await([&] { return DurableOperations(generated) > 0; }, "generated operations durable");
    child.Signal(SIGTERM);
    const ToolRun run = child.Wait();
    EXPECT_EQ(run.status, 143) << run.err;
    EXPECT_THAT(run.err, OneLineWith("stopped by SIGTERM at a durable point: the "));
    const int64 kept = std::stoll(RowValue(run.out, "operations"));
    EXPECT_GT(kept, 0);
    EXPECT_EQ(Shown(generated), ShowText(ModelOf(Generated({kept, 500, 3, 1}))));
    RunOk({"validate", "--store", generated});
}

// SIGINT or SIGTERM to export --out and backup while they write: status
// 130 or 143, no partial file or directory and no target left, and the
// store as it was. A partial left by a killed run is removed by the next.
TEST(ToolSignals, ExportAndBackupRemoveWhatTheyBegan) {
    ScratchDir dir;
    const std::string store = dir.Sub("store");
    RunOk({"record", "--store", store, "--generate", "200000", "--fields", "100000", "--no-sync"});
    const std::string shown = Shown(store);
    for (const int signal : {SIGINT, SIGTERM}) {
        const std::string out = dir.Sub("exported-" + std::to_string(signal));
        Child exporter({"export", "--store", store, "--out", out});
        SignalWhileExists(exporter, out + ".partial-" + std::to_string(exporter.Pid()), signal);
        const ToolRun exported = exporter.Wait();
        EXPECT_EQ(exported.status, 128 + signal) << exported.err;
        EXPECT_THAT(exported.err, OneLineWith("export stopped by SIG"));
        EXPECT_FALSE(fs::exists(out));

        const std::string copy = dir.Sub("copy-" + std::to_string(signal));
        Child backup({"backup", "--store", store, "--to", copy});
        const std::string partial =
            dir.Sub(".copy-" + std::to_string(signal) + ".backup-" + std::to_string(backup.Pid()));
        SignalWhileExists(backup, partial, signal);
        const ToolRun backedUp = backup.Wait();
        EXPECT_EQ(backedUp.status, 128 + signal) << backedUp.err;
        EXPECT_THAT(backedUp.err, OneLineWith("backup stopped by SIG"));
        EXPECT_FALSE(fs::exists(copy));
        EXPECT_FALSE(fs::exists(partial));
    }
    // Nothing else is left beside the targets.
    for (const auto& entry : fs::directory_iterator(dir.Sub(""))) {
        EXPECT_THAT(entry.path().filename().string(), MatchesRegex("store|err|first|status"))
            << entry.path();
    }
    EXPECT_EQ(Shown(store), shown);

    // What a killed run left (its process gone) goes with the next run for
    // the same target; another live process's is kept.
    const std::string out = dir.Sub("out.ops");
    Child killed({"export", "--store", store, "--out", out});
    const std::string stale = out + ".partial-" + std::to_string(killed.Pid());
    SignalWhileExists(killed, stale, SIGKILL);
    killed.Signal(SIGCONT);
    killed.Wait();
    ASSERT_TRUE(fs::exists(stale));
    const std::string live = out + ".partial-" + std::to_string(::getpid());
    dir.Write("out.ops.partial-" + std::to_string(::getpid()), "mine");
    const std::string staleDir = dir.Sub(".copy.backup-999999999");
    fs::create_directory(staleDir);
    ASSERT_TRUE(fs::exists(live));
    EXPECT_EQ(Tool({"export", "--store", store, "--out", out}).status, 0);
    RunOk({"backup", "--store", store, "--to", dir.Sub("copy")});
    EXPECT_FALSE(fs::exists(stale));
    EXPECT_FALSE(fs::exists(staleDir));
    EXPECT_TRUE(fs::exists(live));
    RunOk({"validate", "--store", dir.Sub("copy")});
}

// ---------------------------------------------------------------------------

// The man page and the completion name every command and option of the
// table, and the completion offers no option a command does not take.
TEST(ToolDocs, ManPageAndCompletionFollowTheCommandTable) {
    const std::string man = ReadFile(std::string(OFFSETOPS_SOURCE_DIR) + "/offsetops.1");
    const std::string completion =
        ReadFile(std::string(OFFSETOPS_SOURCE_DIR) + "/offsetops.bash-completion");
    EXPECT_THAT(man,
                HasSubstr(".TH OFFSETOPS 1 \"2026\" \"tarn " + std::string(OFFSETOPS_VERSION)));
    auto escaped = [](const std::string& option) {
        std::string text;
        for (const char c : option) {
            text += c == '-' ? std::string("\\-") : std::string(1, c);
        }
        return text;
    };
    for (const tool::CommandDecl& command : tool::Commands()) {
        EXPECT_THAT(man, HasSubstr(".SS " + command.name + " ")) << command.name;
        std::string expected = command.name + ") echo \"";
        for (const tool::OptionDecl& option : command.options) {
            EXPECT_THAT(man, HasSubstr(escaped(option.name))) << command.name << option.name;
            expected += option.name + (&option == &command.options.back() ? "\"" : " ");
        }
        EXPECT_THAT(completion, HasSubstr(expected)) << command.name;
    }
}

}  // namespace
}  // namespace tarn::testing

#endif  // TARN_HAVE_TOOLS
