// ryaclq as a real process on real files: the grant of each kind of client,
// no grant where no entry applies, listings that read back as the same ACL,
// usage errors, and caches that are written, used or damaged.  Expected
// grants are computed from the permission letters through the library's own
// translation, never written as masks here.
#include <gtest/gtest.h>
#include <sys/time.h>

#include <algorithm>
#include <set>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>
#include <vector>

#include "ryacl.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;

const char kAcl[] =
    "# sample\nn r\no rl\nu unix alice@node1 rwcx\nu unix Bob@node1 rw   # operator\n"
    "u krb5 carol@EXAMPLE.ORG xrwC\ne unix admins rwcxCqledvsao\ng staff rlq\ng auditors rle\ng guests\n";

// English default texts whatever the caller's environment: "NLSPATH"
// without '=' removes the variable (glibc putenv).
const strings kEnv = {"LC_ALL=C", "NLSPATH"};

rytest::run_result q(strings args) {
    args.insert(args.begin(), RYACLQ_PATH);
    return rytest::run(args, "", kEnv);
}

// The line ryaclq prints for a grant written as `letters` in an ACL file.
std::string grant(const char *letters) {
    uint32_t mask = 0;
    EXPECT_EQ(sec_translate_perms(letters, nullptr, &mask), 0);
    char canon[33] = {0};
    EXPECT_EQ(sec_translate_bitmask(mask, nullptr, canon), 0);
    char line[64];
    std::snprintf(line, sizeof line, "%s 0x%08x\n", canon[0] ? canon : "-", mask);
    return line;
}

void expect_answer(const rytest::run_result &r, const std::string &line) {
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, line);
    EXPECT_EQ(r.err, "");
}

// Refused: no answer on stdout, the library's numbered message on stderr.
void expect_refusal(const rytest::run_result &r, int status, const std::string &id) {
    EXPECT_EQ(r.status, status) << r.err;
    EXPECT_EQ(r.out, "");
    EXPECT_NE(r.err.find(id), std::string::npos) << r.err;
}

std::multiset<std::string> lines_of(const std::string &text) {
    std::multiset<std::string> lines;
    for (size_t start = 0, nl; (nl = text.find('\n', start)) != std::string::npos; start = nl + 1)
        lines.insert(text.substr(start, nl - start));
    return lines;
}

class Ryaclq : public ::testing::Test {
protected:
    void SetUp() override { write(file_, kAcl); }
    // An ACL file older than now, so that a cache written now is current.
    void write(const std::string &path, const std::string &text) {
        rytest::write_file(path, text, 0640);
        struct timeval past[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
        ASSERT_EQ(utimes(path.c_str(), past), 0);
    }
    rytest::tmp_dir dir_;
    std::string file_ = dir_ / "service.acl";
};

TEST_F(Ryaclq, AnswersEveryKindOfClient) {
    // Identities, mechanisms and groups match without regard to case.
    const std::pair<strings, const char *> rows[] = {
        {{"--unauthenticated"}, "r"}, {{"-o"}, "rl"}, {{"--identity", "unix:alice@node1"}, "rwcx"},
        {{"-i", "UNIX:bob@NODE1"}, "rw"}, {{"--identity=krb5:carol@example.org"}, "xrwC"},
        {{"--expanded", "unix:Admins"}, "rwcxCqledvsao"}, {{"-g", "staff,AUDITORS"}, "rlqrle"},
        {{"-g", "nosuch,staff"}, "rlq"}, {{"-g", "guests"}, ""}};  // the last grants nothing
    for (auto [args, letters] : rows) {
        args.push_back(file_);
        expect_answer(q(args), grant(letters));
    }
}

TEST_F(Ryaclq, RefusalsGiveTheLibraryMessageAndNoAnswer) {
    struct row { const char *text; strings args; int status; const char *id; } const rows[] = {
        {nullptr, {"-i", "unix:mallory@node1"}, ACL_RC_BAD_ACLE, "4471-147"},
        {nullptr, {"-i", "unix:alice@node1x"}, ACL_RC_BAD_ACLE, "4471-147"},
        {nullptr, {"-e", "unix:alice@node1"}, ACL_RC_BAD_ACLE, "4471-147"},
        {nullptr, {"-g", "nosuch"}, ACL_RC_BAD_ACLE, "4471-147"},
        {nullptr, {"-e", "averyveryverylongmech:admins"}, ACL_RC_BAD_ARGS, "4471-132"},
        {nullptr, {"-u", "root", "-n"}, ACL_RC_BAD_ARGS, "4471-165"},
        {"u unix alice r\n", {"-o"}, ACL_RC_BAD_ACLE, "4471-147"},
        {"n r\nx rw\n", {"-o"}, ACL_RC_BAD_ACL, "4471-179"},
        {"u unix alice r\nu UNIX Alice w\n", {"-l"}, ACL_RC_BAD_ACLE, "4471-157"},
        {"# no entries\n", {"-n"}, ACL_RC_BAD_ACLE, "4471-147"},  // the last, listed below
    };
    for (const row &r : rows) {
        const std::string path = r.text ? dir_ / "other.acl" : file_;
        if (r.text) write(path, r.text);
        strings args = r.args;
        args.push_back(path);
        expect_refusal(q(args), r.status, r.id);
    }
    expect_answer(q({"--list", dir_ / "other.acl"}), "");  // no entries: nothing listed, no error
    expect_refusal(q({"-n", dir_ / "missing.acl"}), ACL_RC_FILE_ERROR, "4471-135");
    expect_refusal(q({"-u", "no_such_user_ryaclq", "-n", "service.acl"}), ACL_RC_UNKNOWN_USER, "4471-140");
}

TEST_F(Ryaclq, WrongUsageGetsTheUsageAndNoAnswer) {
    const std::vector<strings> bad = {
        {}, {file_}, {"--bogus", "-n", file_}, {"-n"}, {"-n", "-o", file_}, {"-n", file_, "extra"},
        {"-i", "alice@node1", file_}, {"-g", "staff,,guests", file_}, {"-g", "", file_},
        {"-u", "root", "-u", "root", "-n", file_}, {"--list=yes", file_}};
    for (const strings &args : bad) {
        auto r = q(args);
        EXPECT_EQ(r.status, ACL_RC_BAD_ARGS) << testing::PrintToString(args);
        EXPECT_EQ(r.out, "");
        EXPECT_NE(r.err.find("Usage: ryaclq"), std::string::npos) << r.err;
    }
    auto help = q({"--help"}), version = q({"-V"});
    EXPECT_EQ(help.status, 0);
    EXPECT_EQ(help.out.rfind("Usage: ryaclq", 0), 0u);
    EXPECT_EQ(version.status, 0);
    EXPECT_NE(version.out.find(RYACL_VERSION), std::string::npos);
}

TEST_F(Ryaclq, ListingReadsBackAsTheSameAcl) {
    auto list = q({"--list", file_});
    ASSERT_EQ(list.status, 0) << list.err;
    EXPECT_NE(list.out.find("u unix Bob@node1 rw # 0x"), std::string::npos) << list.out;
    EXPECT_NE(list.out.find("g guests # 0x00000000\n"), std::string::npos) << list.out;
    EXPECT_EQ(std::count(list.out.begin(), list.out.end(), '\n'), 9);

    const std::string copy = dir_ / "copy.acl";
    rytest::write_file(copy, list.out);
    // The same entries, so the same answers; compiling puts sub-ACLs in
    // reverse order of first appearance, so not in the same order.
    EXPECT_EQ(lines_of(q({"-l", copy}).out), lines_of(list.out));
    auto check = rytest::run_ryaclfck({"-f", copy}, "", kEnv);  // the checker accepts it as it stands
    EXPECT_EQ(check.status, 0) << check.err;
}

TEST_F(Ryaclq, CacheIsWrittenUsedAndVerifiedOnRequest) {
    auto w = q({"--write-cache", "--verbose", "-o", file_});
    EXPECT_EQ(w.out, grant("rl"));
    EXPECT_NE(w.err.find("compiled from the text; cache file written"), std::string::npos) << w.err;
    EXPECT_TRUE(rytest::file_exists(file_ + ".cacl"));
    const std::pair<strings, const char *> reads[] = {
        {{"-v"}, "came from the cache file\n"},
        {{"-v", "--verify-cache"}, "passed validation"},
        {{"-v", "--from-text"}, "compiled from the text; cache file not written"}};
    for (auto [args, says] : reads) {
        args.insert(args.end(), {"-o", file_});
        auto r = q(args);
        EXPECT_EQ(r.out, grant("rl"));
        EXPECT_NE(r.err.find(says), std::string::npos) << r.err;
    }
}

// Whether the library accepts these bytes as a compiled ACL: converted to
// host order if needed, then validated.
bool passes_validation(const std::string &bytes) {
    sec_acl_buffer_desc acl = {0, nullptr};
    if (sec_read_acl_from_data(static_cast<int32_t>(bytes.size()),
                               reinterpret_cast<const unsigned char *>(bytes.data()), &acl) != 0)
        return false;
    bool ok = sec_convert_acl_to_host(1, &acl) == 0 && sec_convert_acl_to_host(1, &acl) == 0;
    std::free(acl.value);  // sec_release_acl refuses a block without the type byte
    return ok;
}

// A current cache cut at every length or with any byte flipped, taken
// without --verify-cache: an answer only from bytes the library accepts,
// otherwise its message and no answer, never a crash.
TEST_F(Ryaclq, DamagedCacheGivesAnErrorNotAGrant) {
    const std::string small = dir_ / "small.acl", cache = small + ".cacl";
    write(small, "n r\no rl\nu unix alice rw\ng staff r\n");
    ASSERT_EQ(q({"-w", "-n", small}).status, 0);
    const std::string good = rytest::read_file(cache);
    ASSERT_GT(good.size(), 5u);
    strings damaged;
    for (size_t len = 1; len < good.size(); ++len) damaged.push_back(good.substr(0, len));
    for (size_t i = 0; i < good.size(); ++i) {
        damaged.push_back(good);
        damaged.back()[i] = static_cast<char>(good[i] ^ 0xff);
    }
    for (const std::string &bad : damaged) {
        rytest::write_file(cache, bad, 0640);
        auto r = q({"-l", small});
        ASSERT_LT(r.status, 128) << r.err;
        if (passes_validation(bad)) {
            EXPECT_EQ(r.status, 0) << r.err;
        } else {
            EXPECT_NE(r.status, 0);
            expect_refusal(r, r.status, "4471-");
        }
    }
}

}  // namespace
