// ryacl query and ryacl list as processes on real files; the commands with
// translated catalogs; the manual pages.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/time.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <regex>
#include <set>

#include "ryacl.h"
#include "ryacl_acl_entry.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;
const size_t npos = std::string::npos;

// English texts whatever the environment ("NLSPATH" without '=' unsets it).
rytest::run_result q(strings args, const char *cmd = "query") {
    args.insert(args.begin(), {RYACL_CMD_PATH, cmd});
    return rytest::run(args, "", {"LC_ALL=C", "NLSPATH"});
}

// The answer for `letters`, through the library's translation rather than a mask written here.
std::string grant(const std::string &letters) {
    uint32_t mask = 0;
    char canon[33] = {0}, line[64];
    EXPECT_TRUE(sec_translate_perms(letters.c_str(), nullptr, &mask) == 0 &&
                sec_translate_bitmask(mask, nullptr, canon) == 0);
    std::snprintf(line, sizeof line, "%s 0x%08x\n", canon[0] ? canon : "-", mask);
    return line;
}

std::multiset<std::string> lines(const std::string &text) {
    std::multiset<std::string> set;
    for (size_t at = 0, nl; (nl = text.find('\n', at)) != npos; at = nl + 1) set.insert(text.substr(at, nl - at));
    return set;
}

struct RyaclQuery : ::testing::Test {
    std::string acl(const std::string &text, const std::string &name = "service.acl") {
        rytest::write_file(dir / name, text, 0640);
        struct timeval past[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
        EXPECT_EQ(utimes((dir / name).c_str(), past), 0);  // so that a cache written now is current
        return dir / name;
    }
    rytest::tmp_dir dir;
    const std::string file = acl("# sample\nn r\no rl\nu unix alice@node1 rwcx\nu unix Bob@node1 rw   # operator\n"
                                 "u krb5 carol@EXAMPLE.ORG xrwC\ne unix admins rwcxCqledvsao\ng staff rlq\n"
                                 "g auditors rle\ng guests\n");
};

TEST_F(RyaclQuery, AnswersRefusalsUsageErrorsAndListings) {
    // Status 0: the grant of these letters on stdout; otherwise this text on stderr, stdout empty.
    const std::string U = "Usage: ryacl query";
    constexpr int NONE = 1, TROUBLE = 2;  // no entry applies; usage or a library failure
    const struct { strings args; int status; std::string says; } rows[] = {
        {{"--unauthenticated", file}, 0, "r"}, {{"-o", file}, 0, "rl"},  // identities, groups: any case
        {{"--identity", "unix:alice@node1", file}, 0, "rwcx"}, {{"-i", "UNIX:bob@NODE1", file}, 0, "rw"},
        {{"--identity=krb5:carol@example.org", file}, 0, "xrwC"}, {{"-g", "guests", file}, 0, ""},
        {{"--expanded", "unix:Admins", file}, 0, "rwcxCqledvsao"}, {{"-g", "staff,AUDITORS", file}, 0, "rlqrle"},
        {{"-g", "nosuch,staff", file}, 0, "rlq"}, {{"-g", "nosuch", file}, NONE, "4471-147"},
        {{"-e", "averyveryverylongmech:admins", file}, TROUBLE, "4471-132"},
        {{"-u", "no_such_user_ryaclq", "-n", "service.acl"}, TROUBLE, "4471-140"},
        {{"-n", dir / "missing.acl"}, TROUBLE, "4471-135"},
        {{"-o", acl("n r\nx rw\n", "bad.acl")}, TROUBLE, "4471-179"},
        {{"-o", acl("o r\no w\n", "twice.acl")}, TROUBLE, "4471-174"},  // 43 from the file: not "no entry"
        {{"-n", acl("# no entries\n", "empty.acl")}, NONE, "4471-147"},  // --list: below
        {{}, TROUBLE, U}, {{file}, TROUBLE, U}, {{"--bogus", "-n", file}, TROUBLE, U}, {{"-n"}, TROUBLE, U},
        {{"-n", "-o", file}, TROUBLE, U}, {{"-n", file, "extra"}, TROUBLE, U}, {{"-i", "alice@node1", file}, TROUBLE, U},
        {{"-g", "staff,,guests", file}, TROUBLE, U}, {{"-g", "", file}, TROUBLE, U},
        {{"-u", "root", "-u", "root", "-n", file}, TROUBLE, U}, {{"--list=yes", file}, TROUBLE, U}};
    for (const auto &row : rows) {
        auto r = q(row.args);
        EXPECT_EQ(r.status, row.status) << testing::PrintToString(row.args) << r.err;
        EXPECT_TRUE(row.status ? r.out.empty() && r.err.find(row.says) != npos
                               : r.out == grant(row.says) && r.err.empty()) << r.out << r.err;
    }
    EXPECT_EQ(q({dir / "empty.acl"}, "list").out, "");  // no entries: nothing listed, no error
    const auto help = q({"--help"}), list_help = q({"--help"}, "list");
    EXPECT_TRUE(!help.status && help.out.rfind(U, 0) == 0);
    EXPECT_TRUE(!list_help.status && list_help.out.rfind("Usage: ryacl list", 0) == 0);
    // A listing holds every entry, reads back as the same ones (compiling reorders), and passes the checker.
    auto list = q({file}, "list");
    EXPECT_TRUE(list.status == 0 && lines(list.out).size() == 9) << list.out << list.err;
    EXPECT_EQ(q({"--list", file}).out, list.out);
    EXPECT_EQ(lines(q({acl(list.out, "copy.acl")}, "list").out), lines(list.out));
    EXPECT_EQ(rytest::run_ryaclfck({"-f", dir / "copy.acl"}).status, 0);
    // list takes no query, and no second file.
    for (const strings &bad : {strings{"-n", file}, strings{"--identity=unix:a", file}, strings{file, file}, strings{}}) {
        const auto r = q(bad, "list");
        EXPECT_TRUE(r.status == TROUBLE && r.out.empty() && r.err.find("Usage: ryacl list") != npos) << r.err;
    }
    const auto told = q({"-v", "-w", file}, "list");
    EXPECT_TRUE(told.status == 0 && told.err.find("compiled from the text; cache file written") != npos) << told.err;
}

// A current cache cut short or with a byte flipped: without -C an answer only
// from bytes the library accepts, else its message; with -C, the text instead.
TEST_F(RyaclQuery, DamagedCacheGivesAnErrorNotAGrant) {
    const std::string small = acl("n r\no rl\nu unix alice rw\ng staff r\n", "small.acl"), cache = small + ".cacl";
    const std::string listing = q({"-l", small}).out;
    ASSERT_EQ(q({"-w", "-n", small}).status, 0);
    const std::string good = rytest::read_file(cache);
    for (size_t i = 1; i < 2 * good.size(); ++i) {
        std::string bad = good;
        if (i < good.size()) bad.resize(i);
        else bad[i - good.size()] ^= '\xff';
        rytest::write_file(cache, bad, 0640);
        sec_acl_buffer_desc acl = {0, nullptr};
        const bool valid = sec_read_acl_from_data(static_cast<int32_t>(bad.size()),
                                                  reinterpret_cast<const unsigned char *>(bad.data()), &acl) == 0 &&
                           sec_convert_acl_to_host(1, &acl) == 0 && sec_convert_acl_to_host(1, &acl) == 0;
        std::free(acl.value);  // sec_release_acl refuses a block without the type byte
        auto r = q({"-l", small});
        EXPECT_TRUE(valid ? r.status == 0 : r.status == 2 && r.out.empty() &&
                                                r.err.find("4471-") != npos) << i << ": " << r.status << r.err;
    }
    rytest::write_file(cache, good.substr(0, good.size() / 2), 0640);  // refused by -C, not read by -t
    EXPECT_TRUE(q({"-C", "-l", small}).out == listing && q({"-t", "-l", small}).out == listing);
}

// Two translations (148, 122) built with gencat into `target`, as an administrator would.
void build_catalog(const rytest::tmp_dir &dir, const std::string &target) {
    rytest::write_file(dir / "fr.msg", "$quote \"\n$set 1\n148 \"4471-162 Echec : l'option -f manque.\\n\"\n"
                                       "122 \"4471-135 Echec : fichier introuvable : %1$s (errno %2$d).\\n\"\n");
    ASSERT_EQ(rytest::run({"/bin/mkdir", "-p", target.substr(0, target.rfind('/'))}).status, 0);
    auto r = rytest::run({RYACL_GENCAT, target, dir / "fr.msg"});
    ASSERT_EQ(r.status, 0) << r.err;
}

std::vector<std::string> env(const std::string &locale, const std::string &nlspath = "") {
    return {"LANG=" + locale, "LC_ALL=" + locale, nlspath.empty() ? "NLSPATH" : "NLSPATH=" + nlspath};
}

// The translation the locale picks, through NLSPATH or installed beside the
// program; texts it lacks, and all in another locale, stay built in.
TEST(Commands, TranslatedCatalogChosenThroughNlspathOrBesideTheProgram) {
    rytest::tmp_dir dir;
    build_catalog(dir, dir / "C.UTF-8/ryseclib.cat");
    const std::string nls = dir / "%L/%N", missing = dir / "missing.acl", usage = acl::msg_text(80);
    const std::string fr = "4471-162 Echec : l'option -f manque.\n", en = acl::msg_text(148) + std::string("\n");
    auto r = rytest::run_ryaclfck({"-v"}, "", env("C.UTF-8", nls));
    EXPECT_TRUE(r.status == 4 && r.err == fr + "\n" + usage + "\n") << r.err;  // the usage is not translated
    EXPECT_EQ(rytest::run_ryaclfck({"-v"}, "", env("C", nls)).err, en + usage + "\n");
    r = rytest::run({RYACL_CMD_PATH, "query", "-n", missing}, "", env("C.UTF-8", nls));  // the library's message
    EXPECT_TRUE(r.status == 2 && r.err.rfind("4471-135 Echec : fichier introuvable : " + missing, 0) == 0) << r.err;
    // <prefix>/share/ryacl/nls/<locale>/ beside <prefix>/bin/ryaclfck, which links statically.
    ASSERT_EQ(mkdir((dir / "bin").c_str(), 0755), 0);
    rytest::write_file(dir / "bin/ryaclfck", rytest::read_file(RYACLFCK_PATH), 0755);
    build_catalog(dir, dir / "share/ryacl/nls/C.UTF-8/ryseclib.cat");
    EXPECT_EQ(rytest::run({dir / "bin/ryaclfck", "-v"}, "", env("C.UTF-8")).err.rfind(fr, 0), 0u);
    EXPECT_EQ(rytest::run({dir / "bin/ryaclfck", "-v"}, "", env("C")).err.rfind(en, 0), 0u);
}

bool has_line(const std::string &text, const std::string &pattern) {
    return std::regex_search(text, std::regex(pattern, std::regex::multiline));
}

TEST(Commands, ManualPagesRenderCleanlyAndDocumentEveryOptionAndLetter) {
    if (rytest::run({"/bin/sh", "-c", "command -v groff"}).status != 0) GTEST_SKIP() << "groff is not installed";
    auto groff = [](strings a) { a.insert(a.begin(), {"/usr/bin/env", "groff", "-man"}); return rytest::run(a); };
    const std::string man = RYACL_SOURCE_DIR "/man/";
    for (const char *page : {"ryaclfck.1", "ryacl.1", "ryacl.3", "ryacl.5"}) {
        auto r = groff({"-ww", "-z", man + page});
        EXPECT_TRUE(r.status == 0 && r.err.empty()) << page << ": " << r.err;
    }
    // One long line per paragraph, no hyphenation: no pattern is split.
    auto render = [&](const char *p) { return groff({"-Tascii", "-P-cbou", "-rLL=250n", "-rHY=0", man + p}).out; };
    const std::string format = render("ryacl.5");
    for (int32_t i = 0; i < acl__default_perm_set.count; ++i) {
        char pattern[64];
        std::snprintf(pattern, sizeof pattern, "^ +%c +0x%08x ", acl__default_perm_set.perms[i].printchar,
                      acl__default_perm_set.perms[i].code);
        EXPECT_TRUE(has_line(format, pattern)) << pattern;
    }
    // Every option in each program's help has its own line in its page.
    const std::string Q = RYACL_CMD_PATH;
    for (auto [prog, page, pattern] : {std::tuple{strings{RYACLFCK_PATH, "-h"}, "ryaclfck.1", "^\t (-[a-z]) \t"},
                                       {strings{Q, "check", "--help"}, "ryacl.1", "^  (-[a-zA-Z], --[a-z-]+)"},
                                       {strings{Q, "query", "--help"}, "ryacl.1", "^  (-[a-zA-Z], --[a-z-]+)"},
                                       {strings{Q, "list", "--help"}, "ryacl.1", "^  (-[a-zA-Z], --[a-z-]+)"},
                                       {strings{Q, "--help"}, "ryacl.1", "^  ([a-z]+|-[a-zA-Z], --[a-z-]+)  "}}) {
        const auto help = rytest::run(prog);
        const std::string text = render(page), both = help.out + help.err;
        const std::regex opt(pattern, std::regex::multiline);
        int seen = 0;
        for (std::sregex_iterator it(both.begin(), both.end(), opt), end; it != end; ++it, ++seen)
            EXPECT_TRUE(has_line(text, "^ +" + (*it)[1].str() + "\\b")) << page << " " << (*it)[1];
        EXPECT_GE(seen, 4) << page << " " << prog[1];  // the pattern still matches the help's layout
    }
}

}  // namespace
