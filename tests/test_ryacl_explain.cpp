// `ryacl explain` as a process: its grant against the library's evaluation
// of the same ACL, from the text and from the cache file; the deciding
// entries and lines; misses; refusals.
#include <gtest/gtest.h>
#include <sys/time.h>

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <random>
#include <set>

#include "ryacl.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;

rytest::run_result explain(strings args) {
    args.insert(args.begin(), {RYACL_PATH, "explain"});
    return rytest::run(args, "", {"LC_ALL=C", "NLSPATH"});
}

// The rule the command applies to expanded identities.
int32_t casecmp_handler(const char *client, const char *entry) { return strcasecmp(client, entry); }

struct RyaclExplain : ::testing::Test {
    rytest::tmp_dir dir;
    std::string acl(const std::string &text, const std::string &name = "s.acl") {
        rytest::write_file(dir / name, text, 0640);
        struct timeval past[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
        utimes((dir / name).c_str(), past);
        return dir / name;
    }
};

TEST_F(RyaclExplain, NamesTheDecidingEntriesAndWhatAMissSearched) {
    const std::string f = acl("# sample\nn r\nu unix alice@node1 rwcx\nu unix Bob rw\ng staff rlq\n"
                              "g auditors rle\ne unix admins rw\n");
    struct probe {
        strings sel;
        int status;
        std::string out;
    } probes[] = {
        {{"--identity=UNIX:ALICE@node1"}, 0, "grant: rwcx (0x0000000f)\ndecided by line 3: u unix alice@node1 rwcx\n"},
        {{"--groups=nobody,STAFF,auditors"}, 0,
         "grant: rqle (0x000000e1)\ngroup nobody: no entry\ngroup STAFF: line 5: g staff rql\n"
         "group auditors: line 6: g auditors rle\n"},
        {{"--unauthenticated"}, 0, "grant: r (0x00000001)\ndecided by line 2: n r\n"},
        {{"--expanded=unix:Admins"}, 0, "grant: rw (0x00000003)\ndecided by line 7: e unix admins rw\n"},
        {{"--anyother"}, 1, "grant: none\nno entry matched: the ACL has no anyother entry\n"},
        {{"--identity=krb5:bob"}, 1, "grant: none\nno entry matched: the ACL has no user entries of mechanism krb5\n"},
        {{"--identity=unix:carol"}, 1,
         "grant: none\nno entry matched: the user entries of mechanism unix (2 entries, 2 searched) hold no identity carol\n"},
        {{"--groups=x"}, 1, "grant: none\nno entry matched: the group entries (2) name none of the groups\ngroup x: no entry\n"},
    };
    for (const probe &p : probes) {
        strings args = p.sel;
        args.push_back(f);
        const auto r = explain(args);
        EXPECT_EQ(r.status, p.status) << p.sel[0];
        EXPECT_EQ(r.out, p.out + "read from: " + f + " (text)\n") << p.sel[0];
        EXPECT_EQ(r.err, "") << p.sel[0];
    }
    const auto none = explain({"--anyother", acl("o\n", "zero.acl")});
    EXPECT_EQ(none.status, 0);
    EXPECT_EQ(none.out.substr(0, 21), "grant: - (0x00000000)");
    const auto ctl = explain({"--identity=unix:ev\x01l", acl("u unix ev\x01l r\n", "ctl.acl")});
    EXPECT_NE(ctl.out.find("line 1: u unix ev\\x01l r\n"), std::string::npos) << ctl.out;
}

TEST_F(RyaclExplain, UsesTheCacheFileWhenTheLibraryWould) {
    const std::string f = acl("u unix alice rw\n");
    ASSERT_EQ(rytest::run_ryaclfck({"-s", "-f", f}).status, 0);
    const auto cached = explain({"--identity=unix:alice", f});
    EXPECT_EQ(cached.out, "grant: rw (0x00000003)\ndecided by cache file: u unix alice rw\nread from: " + f +
                              ".cacl (cache file, current)\n");
    const auto forced = explain({"--text", "--identity=unix:alice", f});
    EXPECT_EQ(forced.out, "grant: rw (0x00000003)\ndecided by line 1: u unix alice rw\nread from: " + f + " (text)\n");
    // A text newer than its cache is read instead, as the library does.
    rytest::write_file(f, "u unix alice r\n", 0640);
    const auto fresh = explain({"--identity=unix:alice", f});
    EXPECT_EQ(fresh.out, "grant: r (0x00000001)\ndecided by line 1: u unix alice r\nread from: " + f + " (text)\n");
}

TEST_F(RyaclExplain, RefusesUsageErrorsAndFaultyFiles) {
    const std::string f = acl("o r\n");
    for (const strings &bad : {strings{"--identity=unix", f}, strings{"--identity=:x", f}, strings{"--groups=a,,b", f},
                               strings{"--bogus", f}, strings{f}, strings{"--anyother"}, strings{"--anyother", "--unauthenticated", f}}) {
        const auto r = explain(bad);
        EXPECT_EQ(r.status, 2) << bad[0];
        EXPECT_NE(r.err.find("Usage: ryacl explain"), std::string::npos) << bad[0];
    }
    const auto help = explain({"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("--unauthenticated"), std::string::npos);
    for (const bool text : {false, true}) {
        strings a{"--anyother", dir / "absent.acl"};
        if (text) a.insert(a.begin(), "--text");
        const auto missing = explain(a);
        EXPECT_EQ(missing.status, 2);
        EXPECT_NE(missing.err.find("4471-1"), std::string::npos) << missing.err;
        a.back() = acl("o r\nu unix\n", "faulty.acl");
        const auto faulty = explain(a);
        EXPECT_EQ(faulty.status, 2);
        EXPECT_NE(faulty.err.find("4471-172"), std::string::npos) << faulty.err;
    }
}

// The grant and the status equal the library's evaluation of the compiled
// ACL, for random ACLs and selectors that hit, miss and differ in case.
TEST_F(RyaclExplain, GrantEqualsTheLibraryEvaluation) {
    for (const char *m : {"unix", "krb5"}) ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, m, casecmp_handler), 0);
    const char *letters = "rwcxCqledvsao";
    std::mt19937 rng(11);
    auto word = [&](int n) { return std::string("id") + std::to_string(rng() % static_cast<unsigned>(n)); };
    auto perms = [&] {
        std::string p;
        for (int i = 0; i < 13; ++i)
            if (rng() % 3 == 0) p += letters[i];
        return p;
    };
    auto recase = [&](std::string s) {
        for (char &c : s)
            if (rng() % 2) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
        return s;
    };
    for (int round = 0; round < 4; ++round) {
        std::string text;
        std::set<std::string> keys;
        if (rng() % 2) text += "n " + perms() + "\n";
        if (rng() % 2) text += "o " + perms() + "\n";
        for (int i = 0; i < 30; ++i) {
            const int kind = static_cast<int>(rng() % 3);
            const std::string mech = rng() % 2 ? "unix" : "krb5", id = word(20);
            const std::string key = std::to_string(kind) + mech + id;
            if (!keys.insert(kind == 2 ? "g" + id : key).second) continue;
            text += (kind == 0 ? "u " + mech + " " : kind == 1 ? "e " + mech + " " : std::string("g ")) + recase(id) + " " +
                    perms() + "\n";
        }
        const std::string f = acl(text, "r" + std::to_string(round) + ".acl");
        sec_buffer_desc buf{0, nullptr};
        uint32_t rflags = 0;
        ASSERT_EQ(sec_read_acl_file(f.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &buf, &rflags), 0);
        if (round % 2) {  // through the cache file too
            ASSERT_EQ(rytest::run_ryaclfck({"-s", "-f", f}).status, 0);
        }
        for (int q = 0; q < 25; ++q) {
            const int kind = static_cast<int>(rng() % 5);
            const std::string mech = rng() % 3 == 0 ? "KRB5" : "unix", id = recase(word(25));
            uint32_t perm = 0;
            int32_t rc;
            strings args;
            if (kind <= 1) {
                const unsigned char type = kind == 0 ? SEC_ACLE_TYPE_USER : SEC_ACLE_TYPE_EXPANDED;
                rc = sec__single_acle_perm(&buf, type, mech.c_str(), nullptr, id.c_str(), &perm);
                args = {(kind == 0 ? "--identity=" : "--expanded=") + mech + ":" + id};
            } else if (kind == 2) {
                std::vector<std::string> names{id, recase(word(25)), recase(word(25))};
                sec_buffer_desc groups[3];
                for (int g = 0; g < 3; ++g) groups[g] = {0, names[static_cast<size_t>(g)].data()};
                rc = sec__group_acles_perm(&buf, 3, groups, &perm);
                args = {"--groups=" + names[0] + "," + names[1] + "," + names[2]};
            } else {
                const unsigned char type = kind == 3 ? SEC_ACLE_TYPE_ANYOTHER : SEC_ACLE_TYPE_UNAUTHENTICATED;
                rc = sec__single_acle_perm(&buf, type, nullptr, nullptr, nullptr, &perm);
                args = {kind == 3 ? "--anyother" : "--unauthenticated"};
            }
            ASSERT_TRUE(rc == 0 || rc == ACL_RC_BAD_ACLE) << rc;
            args.push_back(f);
            const auto r = explain(args);
            EXPECT_EQ(r.status, rc == 0 ? 0 : 1) << args[0] << "\n" << text;
            char want[64];
            if (rc == 0) std::snprintf(want, sizeof want, "(0x%08x)\n", perm);
            else std::snprintf(want, sizeof want, "grant: none\n");
            const std::string first = r.out.substr(0, r.out.find('\n') + 1);
            EXPECT_NE(first.find(want), std::string::npos) << args[0] << ": " << first << "\n" << text;
            EXPECT_EQ(r.out.find("cache file, current") != std::string::npos, round % 2 == 1);
        }
        sec_release_acl(&buf);
    }
}

}  // namespace
