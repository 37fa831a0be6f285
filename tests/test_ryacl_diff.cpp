// `ryacl diff` as a process: text and compiled files in any mix, matching
// without regard to case, the order of its lines, JSON, refusals.
#include <gtest/gtest.h>
#include <sys/time.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <ctime>
#include <map>
#include <random>

#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;

rytest::run_result diff(strings args) {
    args.insert(args.begin(), {RYACL_PATH, "diff"});
    return rytest::run(args, "", {"LC_ALL=C", "NLSPATH"});
}

struct RyaclDiff : ::testing::Test {
    rytest::tmp_dir dir;
    std::string acl(const std::string &name, const std::string &text) {
        rytest::write_file(dir / name, text, 0640);
        struct timeval past[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
        utimes((dir / name).c_str(), past);
        return dir / name;
    }
    // NAME.cacl written by the checker.
    std::string compiled(const std::string &name, const std::string &text) {
        const std::string p = acl(name, text);
        EXPECT_EQ(rytest::run_ryaclfck({"-s", "-f", p}).status, 0);
        return p + ".cacl";
    }
};

TEST_F(RyaclDiff, ReportsGainsLossesAndChangesInAFixedOrder) {
    const std::string o = acl("old.acl", "n r\no rl\nu unix alice rw\nu unix Bob rw\ng staff r\ne unix adm x\n");
    const std::string n = acl("new.acl", "# reordered, respaced, recased\ng   STAFF r\nu krb5 z r\n"
                                         "U UNIX ALICE rwx\no rl # same\ng ops rw\ne unix adm\n");
    const auto r = diff({o, n});
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.err, "");
    // By type (n o u e g), then mechanism, then identity; a change spelt as in NEW.
    EXPECT_EQ(r.out, "- n r\n+ u krb5 z r\n~ u unix ALICE rw -> rwx\n- u unix Bob rw\n~ e unix adm x -> -\n"
                     "+ g ops rw\n");
    const auto back = diff({n, o});
    EXPECT_EQ(back.out, "+ n r\n- u krb5 z r\n~ u unix alice rwx -> rw\n+ u unix Bob rw\n~ e unix adm - -> x\n"
                        "- g ops rw\n");

    const std::string same = acl("same.acl", "\n\nu unix BOB rw\ng staff r\nu unix Alice rw # c\ne unix ADM x\n"
                                             "o rl\nn r\n");
    const auto eq = diff({o, same});
    EXPECT_EQ(eq.status, 0);
    EXPECT_EQ(eq.out, "");
}

TEST_F(RyaclDiff, ComparesCompiledAndTextInAnyMix) {
    const std::string text = "o rl\nu unix alice rw\nu unix bob r\ng staff rlq\n";
    const std::string c = compiled("a.acl", text);
    const std::string t = acl("b.acl", text);
    EXPECT_EQ(diff({c, t}).status, 0);
    EXPECT_EQ(diff({t, c}).status, 0);
    const std::string c2 = compiled("c.acl", "o rl\nu unix alice rw\ng staff rlq\ng ops r\n");
    const auto r = diff({c, c2});
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.out, "- u unix bob r\n+ g ops r\n");
}

// A compiled ACL made elsewhere may hold one key twice: the first counts,
// as evaluation finds the first.
TEST_F(RyaclDiff, CompiledDuplicateCountsOnce) {
    std::string bytes = rytest::read_file(compiled("d.acl", "u unix alice r\nu unix blice w\n"));
    const size_t at = bytes.find("blice");
    ASSERT_NE(at, std::string::npos);
    bytes[at] = 'A';
    const std::string twice = acl("twice.cacl", bytes);
    EXPECT_EQ(diff({twice, acl("r.acl", "u unix alice r\n")}).status, 0);
    const auto r = diff({twice, acl("w.acl", "u unix alice w\n")});
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.out, "~ u unix alice r -> w\n");
}

// Memory that cannot be had is trouble with a message, never an abort.
TEST_F(RyaclDiff, OutOfMemoryIsTroubleNotACrash) {
#if defined(__SANITIZE_ADDRESS__)
    GTEST_SKIP() << "AddressSanitizer cannot run under an address space limit";
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
    GTEST_SKIP() << "AddressSanitizer cannot run under an address space limit";
#endif
#endif
    std::string big;
    for (int i = 0; i < 200000; ++i) big += "u unix someone" + std::to_string(i) + "@node.example.com rw\n";
    const std::string f = acl("big.acl", big);
    const auto r = rytest::run({"/bin/sh", "-c", "ulimit -v 30000; exec \"$0\" diff \"$1\" \"$1\"", RYACL_PATH, f},
                               "", {"LC_ALL=C", "NLSPATH"});
    EXPECT_EQ(r.status, 2) << r.err;
    EXPECT_TRUE(r.err.find("4471-102") != std::string::npos || r.err.find("out of memory") != std::string::npos) << r.err;
}

TEST_F(RyaclDiff, RefusesCorruptedForeignAndFaultyFilesWithTheNumberedMessage) {
    const std::string good = acl("good.acl", "o r\n");
    const std::string bytes = rytest::read_file(compiled("x.acl", "o rl\nu unix alice rw\n"));
    struct probe {
        std::string what, content, message;
    } probes[] = {
        {"sub-ACL length off", [&] { std::string b = bytes; b[5] = static_cast<char>(b[5] + 1); return b; }(), "4471-110"},
        {"entry version", [&] { std::string b = bytes; b[b.size() - 7] = 9; return b; }(), "4471-125"},
        {"foreign byte order", [&] { std::string b = bytes; b[2] = 1; return b; }(), "4471-115"},
        {"header cut", bytes.substr(0, 4), "4471-119"},
        {"faulty text", "o r\nx rw\n", "line 2"},
        {"duplicate", "u unix Al r\nu UNIX aL w\n", "4471-157"},
    };
    for (const probe &p : probes) {
        const std::string f = acl("bad.acl", p.content);
        for (const strings &args : {strings{good, f}, strings{f, good}}) {
            const auto r = diff(args);
            EXPECT_EQ(r.status, 2) << p.what;
            EXPECT_EQ(r.out, "") << p.what;
            EXPECT_NE(r.err.find(p.message), std::string::npos) << p.what << ": " << r.err;
        }
    }
    const auto missing = diff({good, dir / "absent.acl"});
    EXPECT_EQ(missing.status, 2);
    EXPECT_NE(missing.err.find("4471-137"), std::string::npos);
}

TEST_F(RyaclDiff, UsageHelpAndJson) {
    const std::string a = acl("a.acl", "u unix alice rw\ng staff r\nn\n");
    for (const strings &bad : {strings{a}, strings{a, a, a}, strings{"--bogus", a, a}, strings{"--format=xml", a, a}}) {
        const auto r = diff(bad);
        EXPECT_EQ(r.status, 2);
        EXPECT_NE(r.err.find("Usage: ryacl diff"), std::string::npos);
    }
    const auto help = diff({"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("--format=json"), std::string::npos);

    const std::string b = acl("b.acl", "u unix ALICE r\nu unix ev\x01l rw\nn\n");
    const auto j = diff({"--format=json", a, b});
    EXPECT_EQ(j.status, 1);
    EXPECT_EQ(j.out, "{\"version\": 1, \"old\": \"" + a + "\", \"new\": \"" + b +
                         "\", \"same\": false, \"added\": 1, \"removed\": 1, \"changed\": 1, \"differences\": [\n"
                         "  {\"change\": \"changed\", \"type\": \"user\", \"mech\": \"unix\", \"id\": \"ALICE\", "
                         "\"old\": \"rw\", \"new\": \"r\"},\n"
                         "  {\"change\": \"added\", \"type\": \"user\", \"mech\": \"unix\", \"id\": \"ev\\u0001l\", "
                         "\"new\": \"rw\"},\n"
                         "  {\"change\": \"removed\", \"type\": \"group\", \"id\": \"staff\", \"old\": \"r\"}\n]}\n");
    const auto t = diff({a, b});
    EXPECT_NE(t.out.find("+ u unix ev\\x01l rw\n"), std::string::npos) << t.out;
    const auto same = diff({"--format=json", a, a});
    EXPECT_EQ(same.status, 0);
    EXPECT_NE(same.out.find("\"same\": true"), std::string::npos);
    EXPECT_NE(same.out.find("\"differences\": []}"), std::string::npos);
}

// Many entries: every difference found once, nothing else (the index grows
// several times, and identities differ from their match only by case).
TEST_F(RyaclDiff, LargeFilesMatchEveryEntryByItsKey) {
    std::mt19937 rng(7);
    std::string o, n;
    std::map<std::string, int> expect;  // "+ ...", "- ...", "~ ..." lines
    const char *mechs[] = {"unix", "krb5", "hba2"};
    for (int i = 0; i < 20000; ++i) {
        const std::string mech = mechs[i % 3], id = "user" + std::to_string(i) + "@node";
        std::string upper = id;
        for (char &c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
        switch (rng() % 10) {
        case 0: o += "u " + mech + " " + id + " r\n"; expect["- u " + mech + " " + id + " r"]++; break;
        case 1: n += "u " + mech + " " + id + " w\n"; expect["+ u " + mech + " " + id + " w"]++; break;
        case 2:
            o += "u " + mech + " " + id + " r\n";
            n += "u " + mech + " " + upper + " rw\n";
            expect["~ u " + mech + " " + upper + " r -> rw"]++;
            break;
        default:
            o += "u " + mech + " " + id + " rx\n";
            n += "u " + mech + " " + upper + " rx\n";
        }
    }
    const auto r = diff({acl("o.acl", o), acl("n.acl", n)});
    EXPECT_EQ(r.status, 1);
    std::map<std::string, int> got;
    for (size_t at = 0, nl; (nl = r.out.find('\n', at)) != std::string::npos; at = nl + 1) got[r.out.substr(at, nl - at)]++;
    EXPECT_EQ(got.size(), expect.size());
    EXPECT_TRUE(got == expect);
}

}  // namespace
