/*
 * kmctl as a user runs it: the built binary in a child process with a
 * fresh state directory, judged by its exit status and its output.
 */
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

extern char **environ;

namespace {

namespace fs = std::filesystem;

struct CliRun {
    int status = -1; // the exit code; -1 when the child did not exit normally
    std::string out;
    std::string err;
};

std::string slurp(const fs::path &p) {
    std::ifstream in(p, std::ios::binary);
    std::ostringstream s;
    s << in.rdbuf();
    return s.str();
}

// ---- a small JSON reader, to hold the --json output to the grammar ----

struct Json {
    enum Kind { Null, Bool, Number, String, Array, Object } kind = Null;
    bool flag = false;
    double number = 0;
    std::string text;
    std::vector<Json> items;
    std::vector<std::pair<std::string, Json>> members;

    const Json *get(std::string_view key) const {
        for (const auto &[k, v] : members)
            if (k == key)
                return &v;
        return nullptr;
    }
    std::vector<std::string> strings() const {
        std::vector<std::string> s;
        for (const Json &j : items)
            s.push_back(j.kind == String ? j.text : "<not a string>");
        return s;
    }
};

class JsonReader {
public:
    explicit JsonReader(std::string_view in) : in_(in) {}

    // parse - the one value the text holds, or nullopt for anything else.
    std::optional<Json> parse() {
        Json v;
        if (!value(&v))
            return std::nullopt;
        skip();
        if (pos_ != in_.size())
            return std::nullopt;
        return v;
    }

private:
    void skip() {
        while (pos_ < in_.size() && (in_[pos_] == ' ' || in_[pos_] == '\n' || in_[pos_] == '\t' || in_[pos_] == '\r'))
            ++pos_;
    }
    bool eat(char c) {
        skip();
        if (pos_ < in_.size() && in_[pos_] == c) {
            ++pos_;
            return true;
        }
        return false;
    }
    bool word(std::string_view w) {
        if (in_.substr(pos_, w.size()) != w)
            return false;
        pos_ += w.size();
        return true;
    }
    bool string(std::string *out) {
        if (!eat('"'))
            return false;
        while (pos_ < in_.size()) {
            char c = in_[pos_++];
            if (c == '"')
                return true;
            if (static_cast<unsigned char>(c) < 0x20)
                return false;
            if (c != '\\') {
                *out += c;
                continue;
            }
            if (pos_ >= in_.size())
                return false;
            char e = in_[pos_++];
            const std::string_view simple = "\"\\/bfnrt";
            if (simple.find(e) != std::string_view::npos) {
                *out += e;
            } else if (e == 'u' && pos_ + 4 <= in_.size()) {
                *out += '?';
                pos_ += 4;
            } else {
                return false;
            }
        }
        return false;
    }
    bool value(Json *v) {
        skip();
        if (pos_ >= in_.size())
            return false;
        char c = in_[pos_];
        if (c == '{') {
            v->kind = Json::Object;
            ++pos_;
            if (eat('}'))
                return true;
            do {
                std::string key;
                Json member;
                if (!string(&key) || !eat(':') || !value(&member) || v->get(key))
                    return false;
                v->members.emplace_back(key, std::move(member));
            } while (eat(','));
            return eat('}');
        }
        if (c == '[') {
            v->kind = Json::Array;
            ++pos_;
            if (eat(']'))
                return true;
            do {
                Json item;
                if (!value(&item))
                    return false;
                v->items.push_back(std::move(item));
            } while (eat(','));
            return eat(']');
        }
        if (c == '"') {
            v->kind = Json::String;
            return string(&v->text);
        }
        if (word("true") || word("false")) {
            v->kind = Json::Bool;
            v->flag = c == 't';
            return true;
        }
        if (word("null"))
            return true;
        size_t end = in_.find_first_not_of("-+.eE0123456789", pos_);
        if (end == pos_)
            return false;
        std::string digits(in_.substr(pos_, end - pos_));
        char *stop = nullptr;
        v->kind = Json::Number;
        v->number = std::strtod(digits.c_str(), &stop);
        pos_ = end == std::string_view::npos ? in_.size() : end;
        return stop && *stop == '\0';
    }

    std::string_view in_;
    size_t pos_ = 0;
};

TEST(JsonReaderSelfCheck, RejectsWhatIsNotJson) {
    for (const char *bad : {"", "{", "{\"a\":1,}", "[1 2]", "{\"a\":1}{}", "{\"a\":1,\"a\":2}", "[\"x]", "tru"})
        EXPECT_FALSE(JsonReader(bad).parse()) << bad;
    std::optional<Json> ok = JsonReader("{\"a\": [\"b\", 2, true, null], \"c\": {}}\n").parse();
    ASSERT_TRUE(ok);
    EXPECT_EQ(ok->get("a")->items.size(), 4u);
}

// ---- running kmctl ----

// The `info` table: algorithm -> row label -> values as printed.
using Table = std::map<std::string, std::map<std::string, std::string>>;

// Reads the table layout: an algorithm name alone on a line, then rows of
// "  label  values" whose label ends at the first double space.
Table parse_table(const std::string &text, std::vector<std::string> *order) {
    Table t;
    std::istringstream in(text);
    std::string line;
    std::string current;
    while (std::getline(in, line)) {
        if (line.empty())
            continue;
        if (line[0] != ' ') {
            current = line;
            order->push_back(line);
            t[current];
            continue;
        }
        std::string body = line.substr(2);
        size_t gap = body.find("  ");
        if (gap == std::string::npos) {
            ADD_FAILURE() << "row without values: " << line;
            continue;
        }
        size_t start = body.find_first_not_of(' ', gap);
        t[current][body.substr(0, gap)] = body.substr(start);
    }
    return t;
}

class Kmctl : public ::testing::Test {
protected:
    void SetUp() override {
        char tmpl[] = "/tmp/kmctl-test-XXXXXX";
        ASSERT_NE(mkdtemp(tmpl), nullptr);
        dir_ = tmpl;
        state_ = dir_ / "state";
    }
    void TearDown() override {
        std::error_code ec;
        fs::remove_all(dir_, ec);
    }

    // run - kmctl with args, its environment changed by env (an empty
    // value removes the variable).
    CliRun run(const std::vector<std::string> &args, const std::map<std::string, std::string> &env = {}) {
        fs::path out_file = dir_ / "stdout";
        fs::path err_file = dir_ / "stderr";
        std::vector<std::string> argv_s = {KMCTL_PATH};
        argv_s.insert(argv_s.end(), args.begin(), args.end());
        std::vector<std::string> env_s;
        for (char **e = environ; *e; ++e) {
            std::string entry(*e);
            std::string name = entry.substr(0, entry.find('='));
            if (!env.count(name))
                env_s.push_back(entry);
        }
        for (const auto &[name, value] : env)
            if (!value.empty())
                env_s.push_back(name + "=" + value);
        std::vector<char *> argv;
        for (std::string &s : argv_s)
            argv.push_back(s.data());
        argv.push_back(nullptr);
        std::vector<char *> envp;
        for (std::string &s : env_s)
            envp.push_back(s.data());
        envp.push_back(nullptr);

        pid_t pid = fork();
        if (pid == 0) {
            int in = open("/dev/null", O_RDONLY);
            int out = open(out_file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            int err = open(err_file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            if (in < 0 || out < 0 || err < 0 || dup2(in, 0) < 0 || dup2(out, 1) < 0 || dup2(err, 2) < 0)
                _exit(127);
            execve(argv[0], argv.data(), envp.data());
            _exit(127);
        }
        CliRun r;
        int wstatus = 0;
        EXPECT_GT(pid, 0);
        EXPECT_EQ(waitpid(pid, &wstatus, 0), pid);
        if (WIFEXITED(wstatus))
            r.status = WEXITSTATUS(wstatus);
        r.out = slurp(out_file);
        r.err = slurp(err_file);
        return r;
    }

    CliRun info(std::vector<std::string> extra = {}) {
        std::vector<std::string> args = {"--state", state_.string(), "info"};
        args.insert(args.end(), extra.begin(), extra.end());
        return run(args);
    }

    fs::path dir_;
    fs::path state_;
};

const std::string kShaFamily = "md5, sha1, sha_2_224, sha_2_256, sha_2_384, sha_2_512";

// ---- info as a table ----

TEST_F(Kmctl, InfoListsTheAlgorithmsInTaOrder) {
    CliRun r = info();
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.err, "");
    std::vector<std::string> order;
    Table t = parse_table(r.out, &order);
    EXPECT_EQ(order, (std::vector<std::string>{"rsa", "aes", "ec", "hmac"}));
}

TEST_F(Kmctl, InfoAesRows) {
    CliRun r = info();
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<std::string> order;
    const auto aes = parse_table(r.out, &order)["aes"];
    const std::map<std::string, std::string> expected = {
        {"encrypt block modes", "cbc, ecb, ctr, gcm"},
        {"encrypt paddings", "none, pkcs7"},
        {"encrypt digests", "-"},
        {"decrypt block modes", "cbc, ecb, ctr, gcm"},
        {"decrypt paddings", "none, pkcs7"},
        {"decrypt digests", "-"},
        {"import formats", "raw"},
        {"export formats", "-"},
    };
    // Exactly these rows: sign and verify are unsupported and so omitted.
    EXPECT_EQ(aes, expected) << r.out;
}

TEST_F(Kmctl, InfoRsaRows) {
    CliRun r = info();
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<std::string> order;
    auto rsa = parse_table(r.out, &order)["rsa"];
    for (const char *p : {"encrypt", "decrypt"}) {
        SCOPED_TRACE(p);
        EXPECT_EQ(rsa[std::string(p) + " block modes"], "-");
        EXPECT_EQ(rsa[std::string(p) + " paddings"], "none, rsa_pkcs1_1_5_encrypt, rsa_oaep");
        EXPECT_EQ(rsa[std::string(p) + " digests"], "none, " + kShaFamily);
    }
    for (const char *p : {"sign", "verify"}) {
        SCOPED_TRACE(p);
        EXPECT_EQ(rsa[std::string(p) + " block modes"], "-");
        EXPECT_EQ(rsa[std::string(p) + " paddings"], "none, rsa_pss, rsa_pkcs1_1_5_sign");
        EXPECT_EQ(rsa[std::string(p) + " digests"], "none, " + kShaFamily);
    }
    EXPECT_EQ(rsa["import formats"], "pkcs8");
    EXPECT_EQ(rsa["export formats"], "x509");
    EXPECT_EQ(rsa.size(), 14u) << r.out;
}

TEST_F(Kmctl, InfoEcAndHmacOnlySignAndVerify) {
    CliRun r = info();
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<std::string> order;
    Table t = parse_table(r.out, &order);
    for (const char *alg : {"ec", "hmac"}) {
        SCOPED_TRACE(alg);
        const bool hmac = std::string(alg) == "hmac";
        const std::map<std::string, std::string> expected = {
            {"sign block modes", "-"},
            {"sign paddings", "-"},
            {"sign digests", kShaFamily},
            {"verify block modes", "-"},
            {"verify paddings", "-"},
            {"verify digests", kShaFamily},
            {"import formats", hmac ? "raw" : "pkcs8"},
            {"export formats", hmac ? "-" : "x509"},
        };
        EXPECT_EQ(t[alg], expected) << r.out;
    }
}

// ---- info as JSON ----

TEST_F(Kmctl, InfoJsonIsWellFormedAndComplete) {
    CliRun r = info({"--json"});
    ASSERT_EQ(r.status, 0) << r.err;
    std::optional<Json> doc = JsonReader(r.out).parse();
    ASSERT_TRUE(doc) << "not JSON:\n" << r.out;
    ASSERT_EQ(doc->kind, Json::Object);
    const Json *algorithms = doc->get("algorithms");
    ASSERT_TRUE(algorithms && algorithms->kind == Json::Array);
    ASSERT_EQ(algorithms->items.size(), 4u);

    const std::vector<std::pair<std::string, double>> expected = {{"rsa", 1}, {"aes", 32}, {"ec", 3}, {"hmac", 128}};
    std::map<std::string, const Json *> by_name;
    for (size_t i = 0; i < expected.size(); ++i) {
        const Json &a = algorithms->items[i];
        ASSERT_TRUE(a.get("name") && a.get("value") && a.get("purposes"));
        EXPECT_EQ(a.get("name")->text, expected[i].first);
        EXPECT_EQ(a.get("value")->number, expected[i].second);
        by_name[a.get("name")->text] = &a;
    }

    // The lists themselves are held to the table in InfoJsonAndTableAgree.
    const Json *aes = by_name["aes"]->get("purposes");
    ASSERT_TRUE(aes->get("encrypt"));
    EXPECT_EQ(aes->get("encrypt")->get("block_modes")->strings(),
              (std::vector<std::string>{"cbc", "ecb", "ctr", "gcm"}));
    EXPECT_EQ(aes->get("encrypt")->get("digests")->kind, Json::Array);
    EXPECT_EQ(aes->get("sign"), nullptr);
    EXPECT_EQ(by_name["hmac"]->get("purposes")->members.size(), 2u);
    EXPECT_EQ(by_name["hmac"]->get("export_formats")->kind, Json::Array);
}

TEST_F(Kmctl, InfoJsonAndTableAgree) {
    CliRun text = info();
    CliRun json = info({"--json"});
    ASSERT_EQ(text.status, 0);
    ASSERT_EQ(json.status, 0);
    std::vector<std::string> order;
    Table t = parse_table(text.out, &order);
    std::optional<Json> doc = JsonReader(json.out).parse();
    ASSERT_TRUE(doc);
    auto joined = [](const Json *list) {
        if (!list || list->kind != Json::Array)
            return std::string("<missing>");
        std::string s;
        for (const std::string &v : list->strings())
            s += (s.empty() ? "" : ", ") + v;
        return s.empty() ? std::string("-") : s;
    };
    size_t rows = 0;
    for (const Json &a : doc->get("algorithms")->items) {
        const std::string name = a.get("name")->text;
        for (const auto &[purpose, lists] : a.get("purposes")->members) {
            EXPECT_EQ(t[name][purpose + " block modes"], joined(lists.get("block_modes"))) << name;
            EXPECT_EQ(t[name][purpose + " paddings"], joined(lists.get("paddings"))) << name;
            EXPECT_EQ(t[name][purpose + " digests"], joined(lists.get("digests"))) << name;
            rows += 3;
        }
        EXPECT_EQ(t[name]["import formats"], joined(a.get("import_formats")));
        EXPECT_EQ(t[name]["export formats"], joined(a.get("export_formats")));
        rows += 2;
    }
    size_t table_rows = 0;
    for (const auto &[alg, r] : t)
        table_rows += r.size();
    EXPECT_EQ(rows, table_rows);
}

// ---- command line ----

TEST_F(Kmctl, HelpExitsZeroWithoutTouchingState) {
    CliRun sub = run({"--state", state_.string(), "info", "--help"});
    EXPECT_EQ(sub.status, 0);
    EXPECT_NE(sub.out.find("--json"), std::string::npos) << sub.out;
    CliRun top = run({"--state", state_.string(), "--help"});
    EXPECT_EQ(top.status, 0);
    EXPECT_NE(top.out.find("info"), std::string::npos) << top.out;
    EXPECT_NE(top.out.find("--log-level"), std::string::npos) << top.out;
    EXPECT_FALSE(fs::exists(state_));
}

TEST_F(Kmctl, UsageErrorsExitTwo) {
    const std::vector<std::vector<std::string>> cases = {
        {"info", "--bogus"}, // unknown option of the subcommand
        {"--bogus", "info"}, // unknown global option
        {"bogus"},           // unknown subcommand
        {},                  // no subcommand
        {"--log-level", "loud", "info"},
        {"--log-level"},
        {"info", "extra"},
    };
    for (const auto &c : cases) {
        std::vector<std::string> args = {"--state", state_.string()};
        args.insert(args.end(), c.begin(), c.end());
        CliRun r = run(args);
        std::string joined;
        for (const std::string &a : c)
            joined += a + " ";
        EXPECT_EQ(r.status, 2) << joined << "\n" << r.err;
        EXPECT_FALSE(r.err.empty()) << joined;
        EXPECT_EQ(r.out, "") << joined;
    }
    EXPECT_NE(run({"--state", state_.string(), "bogus"}).err.find("bogus"), std::string::npos);
    EXPECT_FALSE(fs::exists(state_)) << "a rejected command line opens no TEE";
}

TEST_F(Kmctl, GlobalOptionsMayFollowTheSubcommand) {
    CliRun r = run({"info", "--state", state_.string()});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_TRUE(fs::is_directory(state_));
}

TEST_F(Kmctl, LogLevelControlsPlatformTrace) {
    CliRun quiet = info();
    ASSERT_EQ(quiet.status, 0);
    EXPECT_EQ(quiet.err, "");
    CliRun chatty = run({"--state", state_.string(), "--log-level", "info", "info"});
    ASSERT_EQ(chatty.status, 0) << chatty.err;
    EXPECT_NE(chatty.err.find("get_support_algo_cnt"), std::string::npos) << chatty.err;
    EXPECT_EQ(chatty.out, quiet.out) << "trace goes to stderr only";
}

// ---- the state directory ----

TEST_F(Kmctl, StateDirectoryIsCreated) {
    fs::path nested = state_ / "a" / "b";
    CliRun r = run({"--state", nested.string(), "info"});
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_TRUE(fs::is_directory(nested));
    EXPECT_TRUE(fs::exists(nested / "device_id"));
    EXPECT_EQ(fs::status(nested).permissions() & fs::perms::all, fs::perms::owner_all);
}

TEST_F(Kmctl, DefaultStateDirectoryFollowsTheEnvironment) {
    fs::path home = dir_ / "home";
    fs::path xdg = dir_ / "xdg";
    fs::path explicit_dir = dir_ / "explicit";
    struct Case {
        const char *what;
        std::map<std::string, std::string> env;
        fs::path expected;
    };
    const Case cases[] = {
        {"KMCTL_STATE wins", {{"KMCTL_STATE", explicit_dir}, {"XDG_STATE_HOME", xdg}, {"HOME", home}}, explicit_dir},
        {"then XDG_STATE_HOME", {{"KMCTL_STATE", ""}, {"XDG_STATE_HOME", xdg}, {"HOME", home}}, xdg / "kmctl"},
        {"a relative XDG_STATE_HOME is ignored",
         {{"KMCTL_STATE", ""}, {"XDG_STATE_HOME", "relative"}, {"HOME", home}},
         home / ".local/state/kmctl"},
        {"then HOME", {{"KMCTL_STATE", ""}, {"XDG_STATE_HOME", ""}, {"HOME", home}}, home / ".local/state/kmctl"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        std::error_code ec;
        fs::remove_all(home, ec);
        fs::remove_all(xdg, ec);
        fs::remove_all(explicit_dir, ec);
        CliRun r = run({"info"}, c.env);
        EXPECT_EQ(r.status, 0) << r.err;
        EXPECT_TRUE(fs::exists(c.expected / "device_id")) << c.expected;
    }
    // --state overrides the environment.
    CliRun r = run({"--state", state_.string(), "info"}, {{"KMCTL_STATE", explicit_dir}});
    EXPECT_EQ(r.status, 0);
    EXPECT_TRUE(fs::exists(state_ / "device_id"));
}

TEST_F(Kmctl, UnusableStateDirectory) {
    CliRun none = run({"info"}, {{"KMCTL_STATE", ""}, {"XDG_STATE_HOME", ""}, {"HOME", ""}});
    EXPECT_EQ(none.status, 2);
    EXPECT_NE(none.err.find("--state"), std::string::npos) << none.err;

    fs::path file = dir_ / "a-file";
    std::ofstream(file) << "x";
    CliRun blocked = run({"--state", (file / "state").string(), "info"});
    EXPECT_EQ(blocked.status, 4);
    EXPECT_NE(blocked.err.find((file / "state").string()), std::string::npos) << blocked.err;
    EXPECT_EQ(blocked.out, "");
}

} // namespace
