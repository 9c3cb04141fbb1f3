/*
 * kmctl as a user runs it: the built binary in a child process with a
 * fresh state directory, judged by its exit status and its output.
 */
#include <fcntl.h>
#include <sys/file.h>
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
#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

#include "scratch_dir.h"

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
    // run - kmctl with args, its environment changed by env (an empty
    // value removes the variable), its stdin read from stdin_file.
    CliRun run(const std::vector<std::string> &args, const std::map<std::string, std::string> &env = {},
               const fs::path &stdin_file = "/dev/null") {
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
            int in = open(stdin_file.c_str(), O_RDONLY);
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

    ScratchDir scratch_{"kmctl-test"};
    const fs::path &dir_ = scratch_.path();
    const fs::path state_ = dir_ / "state";
};

const std::string kShaFamily = "md5, sha1, sha_2_224, sha_2_256, sha_2_384, sha_2_512";

// ---- info as a table ----

TEST_F(Kmctl, InfoListsTheAlgorithmsInTaOrder) {
    CliRun r = info();
    ASSERT_EQ(r.status, 0) << r.err;
    // The first run names the state directory it made; later runs are quiet.
    EXPECT_EQ(r.err, "kmctl: created the state directory " + state_.string() + "\n");
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
    ASSERT_EQ(info().status, 0);
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

// ---- keys and operations ----

using Bytes = std::vector<uint8_t>;

// The characteristics table: tag name -> values as printed.
std::map<std::string, std::string> parse_characteristics(const std::string &text) {
    std::map<std::string, std::string> out;
    std::istringstream in(text);
    std::string line;
    while (std::getline(in, line)) {
        size_t gap = line.find("  ");
        if (gap == std::string::npos) {
            ADD_FAILURE() << "line without a value: " << line;
            continue;
        }
        EXPECT_FALSE(out.count(line.substr(0, gap))) << "tag printed twice: " << line;
        out[line.substr(0, gap)] = line.substr(line.find_first_not_of(' ', gap));
    }
    return out;
}

Bytes hmac_sha256(const Bytes &key, const Bytes &data) {
    unsigned char mac[EVP_MAX_MD_SIZE] = {};
    unsigned int n = 0;
    HMAC(EVP_sha256(), key.data(), static_cast<int>(key.size()), data.data(), data.size(), mac, &n);
    return Bytes(mac, mac + n);
}

class KmctlKeys : public Kmctl {
  protected:
    // km - kmctl on this test's state directory.
    CliRun km(std::vector<std::string> args, const fs::path &stdin_file = "/dev/null") {
        args.insert(args.begin(), {"--state", state_.string()});
        return run(args, {}, stdin_file);
    }
    std::string path(const std::string &name) const { return (dir_ / name).string(); }
    void put(const std::string &name, const Bytes &data) {
        std::ofstream out(dir_ / name, std::ios::binary);
        out.write(reinterpret_cast<const char *>(data.data()), static_cast<std::streamsize>(data.size()));
    }
    Bytes get(const std::string &name) {
        std::string s = slurp(dir_ / name);
        return Bytes(s.begin(), s.end());
    }
    // A 256-bit HMAC-SHA-256 key made by kmctl generate, plus extra options.
    void generate_hmac(const std::string &blob, std::vector<std::string> extra = {}) {
        std::vector<std::string> args = {"generate", "--algorithm",      "hmac", "--size", "256",     "--digest",
                                         "sha256",   "--min-mac-length", "128",  "--out",  path(blob)};
        args.insert(args.end(), extra.begin(), extra.end());
        CliRun r = km(args);
        ASSERT_EQ(r.status, 0) << r.err;
        ASSERT_EQ(r.out, "");
    }

    static Bytes pattern(size_t n) {
        Bytes b(n);
        for (size_t i = 0; i < n; ++i)
            b[i] = static_cast<uint8_t>((i * 31 + i / 251) & 0xFF);
        return b;
    }
};

const std::string kVerificationFailed = "KM_ERROR_VERIFICATION_FAILED (-30): The signature or MAC does not verify.";
const std::string kInvalidKeyBlob = "KM_ERROR_INVALID_KEY_BLOB (-33): The key blob is not valid.";

TEST_F(KmctlKeys, GeneratedKeyDescribesItselfInTextAndJson) {
    generate_hmac("k.blob", {"--tag", "ACTIVE_DATETIME=2026-01-31T12:00:00Z", "--tag", "max-uses-per-boot=9"});
    EXPECT_GT(get("k.blob").size(), 0u);

    CliRun text = km({"characteristics", "--key", path("k.blob")});
    ASSERT_EQ(text.status, 0) << text.err;
    const std::map<std::string, std::string> expected = {
        {"KM_TAG_ALGORITHM", "hmac"},
        {"KM_TAG_KEY_SIZE", "256"},
        {"KM_TAG_PURPOSE", "sign, verify"}, // the algorithm's purposes by default
        {"KM_TAG_DIGEST", "sha_2_256"},
        {"KM_TAG_MIN_MAC_LENGTH", "128"},
        {"KM_TAG_ACTIVE_DATETIME", "2026-01-31T12:00:00Z"},
        {"KM_TAG_MAX_USES_PER_BOOT", "9"},
        {"KM_TAG_NO_AUTH_REQUIRED", "true"}, // added so that the key is usable
        {"KM_TAG_ORIGIN", "generated"},
    };
    EXPECT_EQ(parse_characteristics(text.out), expected) << text.out;

    CliRun json = km({"characteristics", "--key", path("k.blob"), "--json"});
    ASSERT_EQ(json.status, 0) << json.err;
    std::optional<Json> doc = JsonReader(json.out).parse();
    ASSERT_TRUE(doc && doc->kind == Json::Object) << json.out;
    EXPECT_EQ(doc->members.size(), expected.size());
    for (const auto &[name, value] : doc->members)
        EXPECT_TRUE(expected.count(name)) << name << " is not in the text form";
    ASSERT_TRUE(doc->get("KM_TAG_KEY_SIZE") && doc->get("KM_TAG_PURPOSE") && doc->get("KM_TAG_NO_AUTH_REQUIRED"));
    EXPECT_EQ(doc->get("KM_TAG_ALGORITHM")->text, "hmac");
    EXPECT_EQ(doc->get("KM_TAG_KEY_SIZE")->kind, Json::Number);
    EXPECT_EQ(doc->get("KM_TAG_KEY_SIZE")->number, 256);
    EXPECT_EQ(doc->get("KM_TAG_PURPOSE")->strings(), (std::vector<std::string>{"sign", "verify"}));
    EXPECT_EQ(doc->get("KM_TAG_DIGEST")->strings(), std::vector<std::string>{"sha_2_256"}) << "repeatable: an array";
    EXPECT_EQ(doc->get("KM_TAG_NO_AUTH_REQUIRED")->kind, Json::Bool);
    EXPECT_TRUE(doc->get("KM_TAG_NO_AUTH_REQUIRED")->flag);
    EXPECT_EQ(doc->get("KM_TAG_ACTIVE_DATETIME")->text, "2026-01-31T12:00:00Z");
    EXPECT_EQ(doc->get("KM_TAG_ORIGIN")->text, "generated");
}

TEST_F(KmctlKeys, ByteStringsShowTheirLengthOnly) {
    // "secret!" as a parameter the TA keeps visible.
    generate_hmac("k.blob", {"--tag", "ASSOCIATED_DATA=73656372657421"});
    CliRun text = km({"characteristics", "--key", path("k.blob")});
    ASSERT_EQ(text.status, 0) << text.err;
    EXPECT_EQ(parse_characteristics(text.out)["KM_TAG_ASSOCIATED_DATA"], "7 bytes");
    CliRun json = km({"characteristics", "--key", path("k.blob"), "--json"});
    ASSERT_EQ(json.status, 0) << json.err;
    std::optional<Json> doc = JsonReader(json.out).parse();
    ASSERT_TRUE(doc && doc->get("KM_TAG_ASSOCIATED_DATA"));
    const Json *length = doc->get("KM_TAG_ASSOCIATED_DATA")->get("length");
    ASSERT_TRUE(length);
    EXPECT_EQ(length->number, 7);
    for (const std::string &out : {text.out, json.out}) {
        EXPECT_EQ(out.find("secret"), std::string::npos) << out;
        EXPECT_EQ(out.find("7365637265"), std::string::npos) << out;
    }
}

TEST_F(KmctlKeys, NoAuthRequiredIsAddedOnlyWhenAuthIsNotConfigured) {
    generate_hmac("given.blob", {"--tag", "NO_AUTH_REQUIRED"});
    CliRun given = km({"characteristics", "--key", path("given.blob")});
    ASSERT_EQ(given.status, 0) << given.err;
    EXPECT_EQ(parse_characteristics(given.out)["KM_TAG_NO_AUTH_REQUIRED"], "true");

    generate_hmac("user.blob", {"--tag", "USER_SECURE_ID=5", "--tag", "USER_SECURE_ID=6", "--tag", "AUTH_TIMEOUT=60"});
    CliRun user = km({"characteristics", "--key", path("user.blob")});
    ASSERT_EQ(user.status, 0) << user.err;
    auto chars = parse_characteristics(user.out);
    EXPECT_EQ(chars.count("KM_TAG_NO_AUTH_REQUIRED"), 0u) << user.out;
    EXPECT_EQ(chars["KM_TAG_USER_SECURE_ID"], "5, 6");
}

TEST_F(KmctlKeys, MacOfAMultiChunkFileMatchesOpenSsl) {
    const Bytes secret = pattern(32);
    put("raw.key", secret);
    CliRun imported = km({"import", "--algorithm", "hmac", "--digest", "sha256", "--min-mac-length", "128", "--in",
                          path("raw.key"), "--out", path("k.blob")});
    ASSERT_EQ(imported.status, 0) << imported.err;
    CliRun chars = km({"characteristics", "--key", path("k.blob")});
    EXPECT_EQ(parse_characteristics(chars.out)["KM_TAG_ORIGIN"], "imported");
    EXPECT_EQ(parse_characteristics(chars.out)["KM_TAG_KEY_SIZE"], "256");

    // Three 64 KiB pieces and a ragged end.
    const Bytes message = pattern(3 * 65536 + 1017);
    put("msg", message);
    CliRun sign = km({"sign", "--key", path("k.blob"), "--in", path("msg"), "--out", path("mac")});
    ASSERT_EQ(sign.status, 0) << sign.err;
    EXPECT_EQ(sign.out, "");
    EXPECT_EQ(get("mac"), hmac_sha256(secret, message)) << "the whole digest by default";

    CliRun piped = km({"sign", "--key", path("k.blob"), "--out", "-"}, dir_ / "msg");
    ASSERT_EQ(piped.status, 0) << piped.err;
    EXPECT_EQ(Bytes(piped.out.begin(), piped.out.end()), get("mac")) << "stdin to stdout";

    CliRun short_mac =
        km({"sign", "--key", path("k.blob"), "--mac-length", "128", "--in", path("msg"), "--out", path("mac16")});
    ASSERT_EQ(short_mac.status, 0) << short_mac.err;
    const Bytes mac = get("mac");
    EXPECT_EQ(get("mac16"), Bytes(mac.begin(), mac.begin() + 16));
    CliRun too_short =
        km({"sign", "--key", path("k.blob"), "--mac-length", "64", "--in", path("msg"), "--out", path("mac8")});
    EXPECT_EQ(too_short.status, 1);
    EXPECT_NE(too_short.err.find("KM_ERROR_INVALID_MAC_LENGTH"), std::string::npos) << too_short.err;
    EXPECT_FALSE(fs::exists(dir_ / "mac8")) << "no output for a refused operation";
}

TEST_F(KmctlKeys, VerifyHoldsOnlyForTheSignedBytes) {
    generate_hmac("k.blob");
    const Bytes message = pattern(200 * 1024);
    put("msg", message);
    ASSERT_EQ(km({"sign", "--key", path("k.blob"), "--in", path("msg"), "--out", path("mac")}).status, 0);
    ASSERT_EQ(km({"sign", "--key", path("k.blob"), "--mac-length", "160", "--in", path("msg"), "--out", path("mac20")})
                  .status,
              0);

    CliRun ok = km({"verify", "--key", path("k.blob"), "--in", path("msg"), "--signature", path("mac")});
    EXPECT_EQ(ok.status, 0) << ok.err;
    EXPECT_EQ(ok.out, "");
    CliRun truncated = km({"verify", "--key", path("k.blob"), "--in", path("msg"), "--signature", path("mac20")});
    EXPECT_EQ(truncated.status, 0) << "the MAC length follows the signature: " << truncated.err;
    CliRun from_stdin = km({"verify", "--key", path("k.blob"), "--signature", path("mac")}, dir_ / "msg");
    EXPECT_EQ(from_stdin.status, 0) << from_stdin.err;

    // One byte changed past the first piece, one byte more, one byte less.
    std::vector<std::pair<std::string, Bytes>> changed;
    Bytes flipped = message;
    flipped[70000] ^= 1;
    changed.push_back({"flipped", flipped});
    Bytes longer = message;
    longer.push_back(0);
    changed.push_back({"longer", longer});
    changed.push_back({"shorter", Bytes(message.begin(), message.end() - 1)});
    for (const auto &[what, bytes] : changed) {
        SCOPED_TRACE(what);
        put("changed", bytes);
        CliRun bad = km({"verify", "--key", path("k.blob"), "--in", path("changed"), "--signature", path("mac")});
        EXPECT_EQ(bad.status, 1);
        EXPECT_NE(bad.err.find(kVerificationFailed), std::string::npos) << bad.err;
        EXPECT_EQ(bad.out, "");
    }
    Bytes wrong_mac = get("mac");
    wrong_mac[0] ^= 0x40;
    put("wrong-mac", wrong_mac);
    CliRun bad_mac = km({"verify", "--key", path("k.blob"), "--in", path("msg"), "--signature", path("wrong-mac")});
    EXPECT_EQ(bad_mac.status, 1);
    EXPECT_NE(bad_mac.err.find(kVerificationFailed), std::string::npos) << bad_mac.err;
}

TEST_F(KmctlKeys, ApplicationIdAndDataBindTheKey) {
    generate_hmac("k.blob", {"--app-id", "alice", "--app-data", "wonderland"});
    put("msg", pattern(100));
    const std::vector<std::string> sign = {"sign", "--key", path("k.blob"), "--in", path("msg"), "--out", path("mac")};
    struct Case {
        const char *what;
        std::vector<std::string> binding;
    };
    const Case refused[] = {
        {"neither", {}},
        {"wrong id", {"--app-id", "bob", "--app-data", "wonderland"}},
        {"wrong data", {"--app-id", "alice", "--app-data", "land"}},
        {"id only", {"--app-id", "alice"}},
    };
    for (const Case &c : refused) {
        SCOPED_TRACE(c.what);
        std::vector<std::string> args = sign;
        args.insert(args.end(), c.binding.begin(), c.binding.end());
        for (bool with_length : {false, true}) {
            // With a MAC length the refusal comes from begin itself.
            std::vector<std::string> a = args;
            if (with_length)
                a.insert(a.end(), {"--mac-length", "256"});
            CliRun r = km(a);
            EXPECT_EQ(r.status, 1);
            EXPECT_NE(r.err.find(kInvalidKeyBlob), std::string::npos) << r.err;
        }
        std::vector<std::string> describe = {"characteristics", "--key", path("k.blob")};
        describe.insert(describe.end(), c.binding.begin(), c.binding.end());
        EXPECT_EQ(km(describe).status, 1);
    }
    std::vector<std::string> args = sign;
    args.insert(args.end(), {"--app-id", "alice", "--app-data", "wonderland"});
    CliRun ok = km(args);
    EXPECT_EQ(ok.status, 0) << ok.err;
    CliRun verify = km({"verify", "--key", path("k.blob"), "--app-id", "alice", "--app-data", "wonderland", "--in",
                        path("msg"), "--signature", path("mac")});
    EXPECT_EQ(verify.status, 0) << verify.err;
    CliRun chars = km({"characteristics", "--key", path("k.blob"), "--app-id", "alice", "--app-data", "wonderland"});
    ASSERT_EQ(chars.status, 0) << chars.err;
    EXPECT_EQ(chars.out.find("KM_TAG_APPLICATION"), std::string::npos) << "hidden by the TA: " << chars.out;
}

TEST_F(KmctlKeys, BlobsOpenOnlyWithTheStateThatSealedThem) {
    generate_hmac("k.blob");
    put("msg", pattern(10));
    // Every kmctl run is a new process: the blob is reopened from the state directory.
    ASSERT_EQ(km({"sign", "--key", path("k.blob"), "--in", path("msg"), "--out", path("mac")}).status, 0);
    ASSERT_EQ(km({"verify", "--key", path("k.blob"), "--in", path("msg"), "--signature", path("mac")}).status, 0);

    // A user's mistake, not a failure of the TEE: exit 1 with a sentence first.
    const std::string damaged = "the key blob is damaged or was made with another state directory";
    ASSERT_EQ(run({"--state", path("other-state"), "info"}).status, 0);
    CliRun elsewhere = run({"--state", path("other-state"), "characteristics", "--key", path("k.blob")});
    EXPECT_EQ(elsewhere.status, 1);
    EXPECT_NE(elsewhere.err.find("\n" + damaged + " (TEE_ERROR_MAC_INVALID (0xffff3071))\n"), std::string::npos)
        << elsewhere.err;
    CliRun tampered_blob = [&] {
        Bytes blob = get("k.blob");
        blob[blob.size() / 2] ^= 1;
        put("tampered.blob", blob);
        return km({"characteristics", "--key", path("tampered.blob")});
    }();
    EXPECT_EQ(tampered_blob.status, 1);
    EXPECT_NE(tampered_blob.err.find("\n" + damaged), std::string::npos) << tampered_blob.err;
    EXPECT_EQ(tampered_blob.out, "");
}

TEST_F(KmctlKeys, DeleteOneOrAll) {
    generate_hmac("k.blob");
    CliRun one = km({"delete", "--key", path("k.blob")});
    EXPECT_EQ(one.status, 0) << one.err;
    EXPECT_EQ(one.out, "");
    EXPECT_EQ(km({"delete", "--all"}).status, 0);
    put("short.blob", Bytes{7});
    CliRun bad = km({"delete", "--key", path("short.blob")});
    EXPECT_EQ(bad.status, 1);
    EXPECT_NE(bad.err.find(kInvalidKeyBlob), std::string::npos) << bad.err;
    CliRun missing = km({"delete", "--key", path("no-such.blob")});
    EXPECT_EQ(missing.status, 4);
    EXPECT_NE(missing.err.find("no-such.blob"), std::string::npos) << missing.err;
}

TEST_F(KmctlKeys, ExportIsRefusedForSymmetricKeys) {
    generate_hmac("k.blob");
    CliRun r = km({"export", "--key", path("k.blob"), "--out", path("pub")});
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("KM_ERROR_UNSUPPORTED_KEY_FORMAT (-17)"), std::string::npos) << r.err;
    EXPECT_FALSE(fs::exists(dir_ / "pub"));
}

TEST_F(KmctlKeys, EncryptWithASigningKeyLeavesNoOutput) {
    generate_hmac("k.blob");
    put("msg", pattern(100));
    put("out", Bytes{1, 2, 3});
    CliRun r = km({"encrypt", "--key", path("k.blob"), "--in", path("msg"), "--out", path("out")});
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("KM_ERROR_UNSUPPORTED_PURPOSE"), std::string::npos) << r.err;
    EXPECT_EQ(get("out"), (Bytes{1, 2, 3})) << "the old output stays";
    for (const auto &entry : fs::directory_iterator(dir_))
        EXPECT_EQ(entry.path().filename().string().find(".tmp."), std::string::npos) << entry.path();
}

// ---- RSA through PKCS#8, export and OpenSSL ----

struct OsslFree {
    void operator()(EVP_PKEY *p) const { EVP_PKEY_free(p); }
    void operator()(BIO *p) const { BIO_free(p); }
    void operator()(EVP_PKEY_CTX *p) const { EVP_PKEY_CTX_free(p); }
};

TEST_F(KmctlKeys, RsaKeyImportedFromPkcs8ExportsAndSignsForOpenSsl) {
    std::unique_ptr<EVP_PKEY, OsslFree> key(EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", size_t{2048}));
    ASSERT_TRUE(key);
    std::unique_ptr<BIO, OsslFree> pem(BIO_new(BIO_s_mem()));
    ASSERT_EQ(PEM_write_bio_PKCS8PrivateKey(pem.get(), key.get(), nullptr, nullptr, 0, nullptr, nullptr), 1);
    char *pem_data = nullptr;
    long pem_len = BIO_get_mem_data(pem.get(), &pem_data);
    put("key.pem", Bytes(pem_data, pem_data + pem_len));

    CliRun imported = km({"import", "--algorithm", "rsa", "--digest", "sha256", "--padding", "rsa_pkcs1_1_5_sign",
                          "--purpose", "sign,verify", "--in", path("key.pem"), "--out", path("rsa.blob")});
    ASSERT_EQ(imported.status, 0) << imported.err;
    auto chars = parse_characteristics(km({"characteristics", "--key", path("rsa.blob")}).out);
    EXPECT_EQ(chars["KM_TAG_KEY_SIZE"], "2048");
    EXPECT_EQ(chars["KM_TAG_RSA_PUBLIC_EXPONENT"], "65537");

    unsigned char *der = nullptr;
    int der_len = i2d_PUBKEY(key.get(), &der);
    ASSERT_GT(der_len, 0);
    const Bytes spki(der, der + der_len);
    OPENSSL_free(der);
    CliRun exported = km({"export", "--key", path("rsa.blob"), "--format", "der", "--out", path("pub.der")});
    ASSERT_EQ(exported.status, 0) << exported.err;
    EXPECT_EQ(get("pub.der"), spki);
    CliRun as_pem = km({"export", "--key", path("rsa.blob"), "--out", "-"});
    ASSERT_EQ(as_pem.status, 0) << as_pem.err;
    EXPECT_EQ(as_pem.out.rfind("-----BEGIN PUBLIC KEY-----\n", 0), 0u) << as_pem.out;

    const Bytes message = pattern(150 * 1024);
    put("msg", message);
    CliRun sign = km({"sign", "--key", path("rsa.blob"), "--digest", "sha256", "--padding", "rsa_pkcs1_1_5_sign",
                      "--in", path("msg"), "--out", path("sig")});
    ASSERT_EQ(sign.status, 0) << sign.err;
    const Bytes sig = get("sig");
    std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> md(EVP_MD_CTX_new(), EVP_MD_CTX_free);
    ASSERT_EQ(EVP_DigestVerifyInit(md.get(), nullptr, EVP_sha256(), nullptr, key.get()), 1);
    EXPECT_EQ(EVP_DigestVerify(md.get(), sig.data(), sig.size(), message.data(), message.size()), 1)
        << "OpenSSL accepts the TA's signature";
    CliRun verify = km({"verify", "--key", path("rsa.blob"), "--digest", "sha256", "--padding", "rsa_pkcs1_1_5_sign",
                        "--in", path("msg"), "--signature", path("sig")});
    EXPECT_EQ(verify.status, 0) << verify.err;
}

// ---- the key commands' command lines ----

TEST_F(KmctlKeys, BadOptionsAreUsageErrorsBeforeAnyTeeStarts) {
    put("blob", Bytes{1, 2, 3});
    put("msg", Bytes{1});
    const std::string blob = path("blob");
    const std::string msg = path("msg");
    const std::vector<std::string> gen = {"generate", "--algorithm", "hmac", "--size", "256", "--out", path("k")};
    auto with = [](std::vector<std::string> base, std::vector<std::string> more) {
        base.insert(base.end(), more.begin(), more.end());
        return base;
    };
    struct Case {
        std::vector<std::string> args;
        const char *message; // a part of stderr
    };
    const Case cases[] = {
        {with(gen, {"--tag", "KM_TAG_BOGUS=1"}), "unknown tag 'KM_TAG_BOGUS'"},
        {with(gen, {"--tag", "NO_AUTH_REQUIRED=true"}), "takes no value"},
        {with(gen, {"--tag", "ACTIVE_DATETIME=2026-02-30T00:00:00Z"}), "ISO 8601"},
        {with(gen, {"--tag", "ACTIVE_DATETIME=2026-01-31T12:00:00+02:00"}), "bad value"},
        {with(gen, {"--tag", "PURPOSE=sideways"}), "bad value 'sideways' for KM_TAG_PURPOSE"},
        {with(gen, {"--tag", "APPLICATION_ID=abc"}), "hex"},
        {with(gen, {"--tag", "KEY_SIZE"}), "needs a value"},
        {with(gen, {"--tag", "KEY_SIZE=128"}), "KM_TAG_KEY_SIZE may be given only once"},
        {with(gen, {"--tag", "MIN_MAC_LENGTH=4294967296"}), "32-bit"},
        {with(gen, {"--digest", "sha256,sha3"}), "--digest: bad value 'sha3'"},
        {with(gen, {"--size", "big"}), "--size"},
        {{"generate", "--algorithm", "dsa", "--out", path("k")}, "unknown algorithm 'dsa'"},
        {{"generate", "--size", "256", "--out", path("k")}, "--algorithm"},
        {{"generate", "--algorithm", "hmac"}, "--out"},
        {{"import", "--algorithm", "rsa", "--in", msg, "--out", path("k")}, "PKCS#8"},
        {{"import", "--algorithm", "ec", "--in", msg, "--out", path("k")}, "PKCS#8"},
        {{"characteristics"}, "--key"},
        {{"sign", "--key", blob, "--in", msg}, "--out"},
        {{"sign", "--key", blob, "--in", msg, "--out", path("s"), "--param", "MAC_LENGTH=x"}, "MAC_LENGTH"},
        {{"sign", "--key", blob, "--in", msg, "--out", path("s"), "--digest", "sha999"}, "--digest"},
        {{"sign", "--key", "-", "--out", path("s")}, "--key and --in cannot both read stdin"},
        {{"verify", "--key", blob, "--in", msg}, "--signature"},
        {{"verify", "--key", blob, "--signature", "-"}, "--signature and --in cannot both read stdin"},
        {{"encrypt", "--key", blob, "--in", msg, "--out", path("c"), "--nonce", "xyz"}, "KM_TAG_NONCE"},
        {{"export", "--key", blob, "--format", "xml", "--out", path("p")}, "xml"},
        {{"delete"}, "--key BLOB or --all"},
        {{"delete", "--all", "--key", blob}, "excludes"},
    };
    for (const Case &c : cases) {
        std::string joined;
        for (const std::string &a : c.args)
            joined += a + " ";
        SCOPED_TRACE(joined);
        CliRun r = km(c.args);
        EXPECT_EQ(r.status, 2) << r.err;
        EXPECT_NE(r.err.find(c.message), std::string::npos) << r.err;
        EXPECT_EQ(r.out, "");
    }
    EXPECT_FALSE(fs::exists(state_)) << "a rejected command line opens no TEE";
    EXPECT_FALSE(fs::exists(dir_ / "k"));
}

TEST_F(KmctlKeys, EveryCommandHasHelp) {
    const std::pair<const char *, const char *> commands[] = {
        {"generate", "--min-mac-length"},
        {"import", "--in"},
        {"characteristics", "--json"},
        {"delete", "--all"},
        {"export", "--format"},
        {"sign", "--mac-length"},
        {"verify", "--signature"},
        {"encrypt", "--nonce"},
        {"decrypt", "--aad"},
    };
    for (const auto &[command, option] : commands) {
        SCOPED_TRACE(command);
        CliRun r = km({command, "--help"});
        EXPECT_EQ(r.status, 0);
        EXPECT_NE(r.out.find(option), std::string::npos) << r.out;
    }
    CliRun top = km({"--help"});
    for (const auto &[command, option] : commands)
        EXPECT_NE(top.out.find(command), std::string::npos) << command;
    EXPECT_FALSE(fs::exists(state_));
}

// ---- defaults, options named in refusals, MAC lengths ----

// Each key as generate makes it from few options: the defaults table of
// the README, read back through characteristics.
TEST_F(KmctlKeys, DefaultsMakeAKeyUsableAsItIs) {
    struct Case {
        const char *what;
        std::vector<std::string> options;
        std::map<std::string, std::string> expected;
    };
    const Case cases[] = {
        {"HMAC from its algorithm alone",
         {"--algorithm", "hmac"},
         {{"KM_TAG_KEY_SIZE", "256"}, {"KM_TAG_DIGEST", "sha_2_256"}, {"KM_TAG_MIN_MAC_LENGTH", "256"}}},
        {"HMAC sized by its digest, names in any case",
         {"--algorithm", "HMAC", "--digest", "SHA512"},
         {{"KM_TAG_KEY_SIZE", "512"}, {"KM_TAG_DIGEST", "sha_2_512"}, {"KM_TAG_MIN_MAC_LENGTH", "512"}}},
        {"RSA for signing",
         {"--algorithm", "rsa", "--size", "1024", "--purpose", "sign,verify"},
         {{"KM_TAG_PADDING", "rsa_pss, rsa_pkcs1_1_5_sign"},
          {"KM_TAG_DIGEST", "sha_2_256"},
          {"KM_TAG_RSA_PUBLIC_EXPONENT", "65537"}}},
        {"RSA for encryption",
         {"--algorithm", "rsa", "--size", "1024", "--purpose", "encrypt,decrypt"},
         {{"KM_TAG_PADDING", "rsa_oaep"}, {"KM_TAG_DIGEST", "sha_2_256"}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        std::vector<std::string> args = {"generate"};
        args.insert(args.end(), c.options.begin(), c.options.end());
        args.insert(args.end(), {"--out", path("k.blob")});
        CliRun made = km(args);
        ASSERT_EQ(made.status, 0) << made.err;
        CliRun chars = km({"characteristics", "--key", path("k.blob")});
        ASSERT_EQ(chars.status, 0) << chars.err;
        std::map<std::string, std::string> got = parse_characteristics(chars.out);
        for (const auto &[tag, value] : c.expected)
            EXPECT_EQ(got[tag], value) << tag << "\n" << chars.out;
        EXPECT_EQ(got["KM_TAG_NO_AUTH_REQUIRED"], "true");
    }
    // What kmctl cannot choose well, it asks for by option, before any TEE.
    fs::remove_all(state_);
    CliRun aes = km({"generate", "--algorithm", "aes", "--block-mode", "gcm", "--out", path("a.blob")});
    EXPECT_EQ(aes.status, 2);
    EXPECT_EQ(aes.err.rfind("an AES key needs --size: 128, 192 or 256\n", 0), 0u) << aes.err;
    EXPECT_FALSE(fs::exists(state_));
}

// An operation takes the key's only padding or digest; where
// the key allows several, the refusal names the option to add.
TEST_F(KmctlKeys, OperationsTakeTheKeysOnlyChoiceOrNameTheOption) {
    ASSERT_EQ(
        km({"generate", "--algorithm", "rsa", "--size", "1024", "--purpose", "sign", "--out", path("two.blob")}).status,
        0);
    ASSERT_EQ(km({"generate", "--algorithm", "rsa", "--size", "1024", "--purpose", "sign,verify", "--padding",
                  "rsa_pkcs1_1_5_sign", "--out", path("one.blob")})
                  .status,
              0);
    ASSERT_EQ(km({"generate", "--algorithm", "rsa", "--size", "1024", "--purpose", "sign", "--padding", "rsa_pss",
                  "--digest", "sha256,sha512", "--out", path("digests.blob")})
                  .status,
              0);
    put("msg", pattern(100));

    CliRun ambiguous = km({"sign", "--key", path("two.blob"), "--in", path("msg"), "--out", path("sig")});
    EXPECT_EQ(ambiguous.status, 2);
    EXPECT_EQ(ambiguous.err.rfind("sign needs --padding: the key allows rsa_pss, rsa_pkcs1_1_5_sign\n", 0), 0u)
        << ambiguous.err;
    EXPECT_EQ(ambiguous.err.find("KM_TAG_"), std::string::npos) << "the option, not the tag";
    EXPECT_FALSE(fs::exists(dir_ / "sig"));

    CliRun chosen = km({"sign", "--key", path("one.blob"), "--in", path("msg"), "--out", path("sig")});
    ASSERT_EQ(chosen.status, 0) << chosen.err;
    CliRun verified = km({"verify", "--key", path("one.blob"), "--in", path("msg"), "--signature", path("sig")});
    EXPECT_EQ(verified.status, 0) << verified.err;

    CliRun digest = km({"sign", "--key", path("digests.blob"), "--in", path("msg"), "--out", path("sig")});
    EXPECT_EQ(digest.status, 2);
    EXPECT_EQ(digest.err.rfind("sign needs --digest: the key allows sha_2_256, sha_2_512\n", 0), 0u) << digest.err;
    CliRun given =
        km({"sign", "--key", path("digests.blob"), "--digest", "SHA512", "--in", path("msg"), "--out", path("sig512")});
    EXPECT_EQ(given.status, 0) << given.err;
}

TEST_F(KmctlKeys, MacLengthsAreWholeBytesUpToTheDigest) {
    const Bytes secret = pattern(32);
    put("raw.key", secret);
    ASSERT_EQ(km({"import", "--algorithm", "hmac", "--digest", "sha256", "--min-mac-length", "128", "--in",
                  path("raw.key"), "--out", path("k.blob")})
                  .status,
              0);
    put("msg", pattern(1000));
    const Bytes full = hmac_sha256(secret, pattern(1000));

    for (const char *bad : {"100", "0", "264", "1024"}) {
        SCOPED_TRACE(bad);
        CliRun r = km({"sign", "--key", path("k.blob"), "--mac-length", bad, "--in", path("msg"), "--out", path("m")});
        EXPECT_EQ(r.status, 2) << r.err;
        EXPECT_EQ(r.err.rfind("--mac-length: ", 0), 0u) << r.err;
        EXPECT_FALSE(fs::exists(dir_ / "m"));
    }
    CliRun r = km({"sign", "--key", path("k.blob"), "--mac-length", "256", "--in", path("msg"), "--out", path("m")});
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(get("m"), full);

    // A MAC longer than the digest cannot hold; a truncated one can.
    Bytes longer = full;
    longer.push_back(0);
    put("long", longer);
    CliRun too_long = km({"verify", "--key", path("k.blob"), "--in", path("msg"), "--signature", path("long")});
    EXPECT_EQ(too_long.status, 1);
    EXPECT_EQ(too_long.err, kVerificationFailed + "\n");
    put("short", Bytes(full.begin(), full.begin() + 20));
    CliRun truncated = km({"verify", "--key", path("k.blob"), "--in", path("msg"), "--signature", path("short")});
    EXPECT_EQ(truncated.status, 0) << truncated.err;
}

// ---- the state directory lock ----

// A kmctl that finds the state directory locked waits, says so after a
// second, and runs once the lock is released.
TEST_F(Kmctl, SecondProcessWaitsForTheStateLock) {
    ASSERT_EQ(info().status, 0);
    int lock_fd = open((state_ / "lock").c_str(), O_RDWR | O_CLOEXEC);
    ASSERT_GE(lock_fd, 0);
    ASSERT_EQ(flock(lock_fd, LOCK_EX), 0);

    int err_pipe[2] = {-1, -1};
    ASSERT_EQ(pipe2(err_pipe, O_CLOEXEC), 0);
    fs::path out_file = dir_ / "waiting.out";
    pid_t pid = fork();
    if (pid == 0) {
        int out = open(out_file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        if (out < 0 || dup2(out, 1) < 0 || dup2(err_pipe[1], 2) < 0)
            _exit(127);
        execl(KMCTL_PATH, KMCTL_PATH, "--state", state_.c_str(), "--log-level", "none", "info", nullptr);
        _exit(127);
    }
    ASSERT_GT(pid, 0);
    close(err_pipe[1]);
    // Blocks until kmctl speaks: its notice is the first thing it writes.
    std::string notice;
    char c = 0;
    while (read(err_pipe[0], &c, 1) == 1 && c != '\n')
        notice += c;
    EXPECT_EQ(notice, "kmctl: waiting for another kmctl using the state directory " + state_.string());
    EXPECT_EQ(slurp(out_file), "") << "ran while the directory was locked";
    close(lock_fd);
    int wstatus = 0;
    ASSERT_EQ(waitpid(pid, &wstatus, 0), pid);
    close(err_pipe[0]);
    EXPECT_TRUE(WIFEXITED(wstatus) && WEXITSTATUS(wstatus) == 0);
    EXPECT_NE(slurp(out_file).find("rsa"), std::string::npos);
}

} // namespace
