// ryacl check, and the command's dispatcher, as processes: one opinion with
// `ryaclfck -c` on every file, exit statuses, troubles, standard input,
// caches, users, escaping.  JSON and SARIF: ryacl_check_formats.py.
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <regex>

#include "ryacl.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;
const size_t npos = std::string::npos;
const std::string kGolden = RYACL_SOURCE_DIR "/tests/golden/";

rytest::run_result ryacl(strings args, const std::string &cwd = "") {
    args.insert(args.begin(), RYACL_CMD_PATH);
    return rytest::run(args, cwd, {"LC_ALL=C", "NLSPATH"});
}

// Faulty texts beyond the golden ones: every message of the parser and of
// the trees, CR LF and form feed line counting, a NUL, the longest line.
const char *const kMoreFaults[] = {
    "u unix alice rw\r\nu unix ALICE r\r\ng\r\n",
    "n r\fn w\fx\n",
    "e averyveryverylongmechanism a r\nu unix\nn rw x\nn rw#x\ng staff q\n",
    "o r\n# comment\n\n   \t\nu krb5 bob rw # note\nU KRB5 BOB r\ne unix grp r\ne UNIX GRP w\ng s r\ng S w\n",
    "nn rw\no r\no r\n",
};

std::vector<std::pair<std::string, std::string>> all_cases() {
    std::vector<std::pair<std::string, std::string>> cases;
    for (const std::string &g : rytest::list_dir(kGolden))
        if (rytest::file_exists(kGolden + g + "/input")) cases.emplace_back(g, rytest::read_file(kGolden + g + "/input"));
    for (const char *t : kMoreFaults) cases.emplace_back(t, t);
    cases.emplace_back("NUL", std::string("n r\no r\0x\ng g r\n", 13));
    cases.emplace_back("long", std::string(1095, 'n') + "\n" + std::string(1096, '#') + "\no r\n");
    return cases;
}

// The text report is the checker's -c output with "acl:LINE: " before each
// message, LINE being the one the message names, if it names one.
TEST(RyaclCheck, SameMessagesAndLinesAsTheCheckerOnEveryFile) {
    const std::regex prefix("^acl:([0-9]+): "), named("line ([0-9]+)");
    for (const auto &[name, text] : all_cases()) {
        rytest::tmp_dir dir;
        rytest::write_file(dir / "acl", text);
        const auto fck = rytest::run_ryaclfck({"-c", "-f", "acl"}, dir.path(), {"LC_ALL=C"});
        const auto r = ryacl({"check", "acl"}, dir.path()), gcc = ryacl({"check", "--format=gcc", "acl"}, dir.path());
        EXPECT_EQ(r.status, fck.err.empty() ? 0 : 1) << name;
        EXPECT_TRUE(r.err.empty() && gcc.err.empty()) << name << r.err;
        std::string stripped;
        size_t blocks = 0;
        for (size_t at = 0; at < r.out.size(); ++blocks) {
            const size_t end = std::min(r.out.find("\n\nacl:", at), r.out.size() - 2) + 2;  // block and its blank line
            std::string block = r.out.substr(at, end - at);
            std::smatch m, line;
            ASSERT_TRUE(std::regex_search(block, m, prefix)) << name << block;
            if (std::regex_search(block, line, named)) {
                EXPECT_EQ(m[1].str(), line[1].str()) << name << block;
            }
            stripped += block.substr(m[0].length());
            at = end;
        }
        EXPECT_EQ(stripped, fck.err) << name;
        EXPECT_EQ(std::count(gcc.out.begin(), gcc.out.end(), '\n'), static_cast<long>(blocks)) << name;
        EXPECT_EQ(gcc.status, r.status) << name;
        EXPECT_EQ(rytest::list_dir(dir.path()), strings{"acl"}) << name;  // no cache without --cache
    }
}

TEST(RyaclCheck, DuplicatesAreReportedAtTheRepeatedEntryInEveryFormat) {
    rytest::tmp_dir dir;
    rytest::write_file(dir / "acl", "u unix a r\n\n# c\nu unix A w\ng staff r\n");
    auto r = ryacl({"check", "--format=gcc", "acl"}, dir.path());
    EXPECT_EQ(r.out, "acl:4: error: 4471-157 Failure: Duplicate entries in the ACL.  The ACL already\n");
    EXPECT_EQ(r.status, 1);
    r = ryacl({"check", "--format=json", "acl"}, dir.path());
    EXPECT_NE(r.out.find("\"line\": 4, \"id\": \"4471-157\", \"number\": 157, \"rc\": 43"), npos) << r.out;
    EXPECT_NE(r.out.find("\"entries\": 2"), npos) << r.out;
}

TEST(RyaclCheck, ExitStatusesUsageAndUnreadableFiles) {
    rytest::tmp_dir dir;
    rytest::write_file(dir / "good", "o r\n");
    rytest::write_file(dir / "bad", "o r\nx\n");
    ASSERT_EQ(mkdir((dir / "adir").c_str(), 0755), 0);
    const struct { strings args; int status; std::string out, err; } rows[] = {
        {{"check", "good"}, 0, "", ""},
        {{"check", "good", "bad"}, 1, "bad:2: 4471-179 ", ""},
        {{"check", "--format=gcc", "bad", "missing", "good"}, 2, "bad:2: error: 4471-179 ", "missing: 4471-168 "},
        {{"check", "adir"}, 2, "", "adir: 4471-168 "},
        {{"check"}, 2, "", "Usage: ryacl check"},
        {{"check", "--format=xml", "good"}, 2, "", "Usage: ryacl check"},
        {{"check", "--bogus", "good"}, 2, "", "Usage: ryacl check"},
        {{"check", "--user=a", "--user=b", "good"}, 2, "", "Usage: ryacl check"},
        {{"check", "--help"}, 0, "Usage: ryacl check", ""},
        {{}, 2, "", "Usage: ryacl COMMAND"},
        {{"bogus"}, 2, "", "ryacl: 'bogus' is not a ryacl command\nUsage: ryacl COMMAND"},
        {{"--bogus"}, 2, "", "Usage: ryacl COMMAND"},
        {{"--help"}, 0, "Usage: ryacl COMMAND", ""},
        {{"--version"}, 0, "ryacl " RYACL_VERSION "\n", ""},
    };
    for (const auto &row : rows) {
        const auto r = ryacl(row.args, dir.path());
        EXPECT_EQ(r.status, row.status) << testing::PrintToString(row.args) << r.err;
        EXPECT_EQ(r.out.find(row.out), 0u) << testing::PrintToString(row.args) << r.out;
        EXPECT_TRUE(row.err.empty() ? r.err.empty() : r.err.find(row.err) != npos) << testing::PrintToString(row.args) << r.err;
    }
}

TEST(RyaclCheck, StandardInputAndEscapedControlCharacters) {
    rytest::tmp_dir dir;
    rytest::write_file(dir / "acl", "u unix a\x1b]0;x\x07 r\nu unix A\x1b]0;X\x07 w\n");
    const auto r = rytest::run({"/bin/sh", "-c", std::string(RYACL_CMD_PATH) + " check - < acl"}, dir.path(), {"LC_ALL=C"});
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.out.find('\x1b'), npos) << r.out;
    EXPECT_NE(r.out.find("-:2: 4471-157 "), npos) << r.out;
    EXPECT_NE(r.out.find("identity: A\\x1b]0;X\\x07."), npos) << r.out;
    const auto json = ryacl({"check", "--format=json", "acl"}, dir.path());
    EXPECT_EQ(json.out.find('\x1b'), npos) << json.out;
    EXPECT_NE(json.out.find("identity: A\\\\x1b]0;X\\\\x07."), npos) << json.out;  // the text \x1b, JSON-escaped
    const auto empty = rytest::run({"/bin/sh", "-c", std::string(RYACL_CMD_PATH) + " check - < /dev/null"});
    EXPECT_TRUE(empty.status == 0 && empty.out.empty()) << empty.out;
    const auto closed = rytest::run({"/bin/sh", "-c", std::string(RYACL_CMD_PATH) + " check - <&-"});
    EXPECT_TRUE(closed.status == 2 && closed.err.rfind("-: ryacl: standard input: ", 0) == 0) << closed.err;
    const auto full = rytest::run({"/bin/sh", "-c", std::string(RYACL_CMD_PATH) + " --help > /dev/full"});
    EXPECT_TRUE(full.status == 2 && full.err.find("ryacl: standard output: ") != npos) << full.err;
}

// --cache stores what ryaclfck -s stores, with the file's mode; only for
// clean files, never for a user's file.
TEST(RyaclCheck, CacheOfEachCleanFileAsTheCheckerWritesIt) {
    rytest::tmp_dir dir;
    const std::string text = "o r\nu unix alice rw\ng staff rlq\ne krb5 x r\n";
    for (const char *f : {"mine", "theirs"}) rytest::write_file(dir / f, text, 0640);
    rytest::write_file(dir / "bad", text + "g staff r\n", 0640);
    ASSERT_EQ(rytest::run_ryaclfck({"-s", "-f", dir / "theirs"}).status, 0);
    const auto r = ryacl({"check", "--cache", "mine", "bad"}, dir.path());
    EXPECT_EQ(r.status, 1) << r.err;
    EXPECT_TRUE(r.err.empty()) << r.err;
    EXPECT_EQ(rytest::read_file(dir / "mine.cacl"), rytest::read_file(dir / "theirs.cacl"));
    struct stat st {};
    EXPECT_TRUE(stat((dir / "mine.cacl").c_str(), &st) == 0 && (st.st_mode & 07777) == 0640);
    EXPECT_FALSE(rytest::file_exists(dir / "bad.cacl"));
}

TEST(RyaclCheck, UserFileMustBeTheirsAndIsNeverCached) {
    const passwd *pw = getpwuid(geteuid());
    if (!pw || access(pw->pw_dir, W_OK) != 0 || std::string(pw->pw_dir) == "/") GTEST_SKIP() << "no usable home";
    const std::string user = pw->pw_name, base = ".ryacl-check-" + std::to_string(getpid());
    const std::string path = std::string(pw->pw_dir) + "/" + base;
    rytest::write_file(path, "n r\n", 0644);
    auto r = ryacl({"check", "--cache", "--user=" + user, base});
    EXPECT_EQ(r.status, 0);
    EXPECT_NE(r.err.find("4471-164 "), npos) << r.err;
    EXPECT_FALSE(rytest::file_exists(path + ".cacl"));
    chmod(path.c_str(), 0664);
    r = ryacl({"check", "-u", user, base});
    EXPECT_EQ(r.status, 2);
    EXPECT_NE(r.err.find(base + ": 4471-169 "), npos) << r.err;
    unlink(path.c_str());
}

}  // namespace
