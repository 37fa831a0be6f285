// ryaclq as a real process on real files: the grant of each kind of client,
// no grant where no entry applies, listings that read back as the same ACL,
// usage errors, bad files and users, and caches that are stale, mismatched
// or damaged.  Expected grants are computed from the permission letters
// through the library's own translation, never written as masks here.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/time.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <regex>
#include <string>
#include <vector>

#include "ryacl.h"
#include "ryacl_test_support.h"

namespace {

const char kAcl[] =
    "# sample\n"
    "n r\n"
    "o rl\n"
    "u unix alice@node1 rwcx\n"
    "u unix Bob@node1 rw   # operator\n"
    "u krb5 carol@EXAMPLE.ORG xrwC\n"
    "e unix admins rwcxCqledvsao\n"
    "g staff rlq\n"
    "g auditors rle\n"
    "g guests\n";

// English default texts whatever the caller's environment: "NLSPATH"
// without '=' removes the variable (glibc putenv).
const std::vector<std::string> kEnv = {"LC_ALL=C", "NLSPATH"};

rytest::run_result q(std::vector<std::string> args) {
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
void expect_refusal(const rytest::run_result &r, int status, const char *id) {
    EXPECT_EQ(r.status, status) << r.err;
    EXPECT_EQ(r.out, "");
    EXPECT_NE(r.err.find(id), std::string::npos) << r.err;
}

void set_mtime_at(const std::string &path, time_t when) {
    struct timeval tv[2] = {{when, 0}, {when, 0}};
    ASSERT_EQ(utimes(path.c_str(), tv), 0);
}

void set_mtime(const std::string &path, long seconds_from_now) {
    struct timeval now;
    gettimeofday(&now, nullptr);
    set_mtime_at(path, now.tv_sec + seconds_from_now);
}

time_t mtime_of(const std::string &path) {
    struct stat st;
    EXPECT_EQ(stat(path.c_str(), &st), 0);
    return st.st_mtime;
}

std::vector<std::string> sorted_lines(const std::string &text) {
    std::vector<std::string> lines;
    size_t start = 0, nl;
    while ((nl = text.find('\n', start)) != std::string::npos) {
        lines.push_back(text.substr(start, nl - start));
        start = nl + 1;
    }
    std::sort(lines.begin(), lines.end());
    return lines;
}

// Whether the library accepts these bytes as a compiled ACL: converted to
// host order if needed, then validated.
bool passes_validation(const std::string &bytes) {
    sec_acl_buffer_desc acl = {0, nullptr};
    if (sec_read_acl_from_data(static_cast<int32_t>(bytes.size()),
                               reinterpret_cast<const unsigned char *>(bytes.data()), &acl) != 0)
        return false;
    bool ok = sec_convert_acl_to_host(1, &acl) == 0 && sec_convert_acl_to_host(1, &acl) == 0;
    free(acl.value);  // sec_release_acl refuses a block without the type byte
    return ok;
}

class Ryaclq : public ::testing::Test {
protected:
    void SetUp() override {
        file_ = dir_ / "service.acl";
        rytest::write_file(file_, kAcl, 0640);
        set_mtime(file_, -100);  // so that a cache written now is current
    }
    rytest::tmp_dir dir_;
    std::string file_;
};

TEST_F(Ryaclq, AnswersEveryKindOfClient) {
    expect_answer(q({"--unauthenticated", file_}), grant("r"));
    expect_answer(q({"-o", file_}), grant("rl"));
    expect_answer(q({"--identity", "unix:alice@node1", file_}), grant("rwcx"));
    // Identities, mechanisms and groups match without regard to case.
    expect_answer(q({"-i", "UNIX:bob@NODE1", file_}), grant("rw"));
    expect_answer(q({"--identity=krb5:carol@example.org", file_}), grant("xrwC"));
    expect_answer(q({"--expanded", "unix:Admins", file_}), grant("rwcxCqledvsao"));
    expect_answer(q({"-g", "staff,AUDITORS", file_}), grant("rlqrle"));
    expect_answer(q({"-g", "nosuch,staff", file_}), grant("rlq"));
    expect_answer(q({"-g", "guests", file_}), grant(""));  // an entry granting nothing
}

TEST_F(Ryaclq, NoApplicableEntryIsNeverAGrant) {
    expect_refusal(q({"-i", "unix:mallory@node1", file_}), ACL_RC_BAD_ACLE, "4471-147");
    expect_refusal(q({"-i", "ldap:alice@node1", file_}), ACL_RC_BAD_ACLE, "4471-147");
    expect_refusal(q({"-i", "unix:alice@node1x", file_}), ACL_RC_BAD_ACLE, "4471-147");
    expect_refusal(q({"-e", "unix:alice@node1", file_}), ACL_RC_BAD_ACLE, "4471-147");
    expect_refusal(q({"-g", "nosuch", file_}), ACL_RC_BAD_ACLE, "4471-147");
    // The library's refusal of a mechanism no handler can be registered for.
    expect_refusal(q({"-e", "averyveryverylongmech:admins", file_}), ACL_RC_BAD_ARGS, "4471-132");

    std::string few = dir_ / "few.acl";
    rytest::write_file(few, "u unix alice r\n");
    expect_refusal(q({"-n", few}), ACL_RC_BAD_ACLE, "4471-147");
    expect_refusal(q({"-o", few}), ACL_RC_BAD_ACLE, "4471-147");

    // Files without entries: nothing is granted, nothing is listed.
    for (const char *text : {"", "# only a comment\n\n"}) {
        std::string empty = dir_ / "empty.acl";
        rytest::write_file(empty, text);
        expect_refusal(q({"-n", empty}), ACL_RC_BAD_ACLE, "4471-147");
        expect_refusal(q({"-g", "staff", empty}), ACL_RC_BAD_ACLE, "4471-147");
        expect_answer(q({"--list", empty}), "");
    }
}

TEST_F(Ryaclq, ListingReadsBackAsTheSameAcl) {
    auto list = q({"--list", file_});
    ASSERT_EQ(list.status, 0) << list.err;
    EXPECT_NE(list.out.find("u unix Bob@node1 rw # 0x"), std::string::npos) << list.out;
    EXPECT_NE(list.out.find("g guests # 0x00000000\n"), std::string::npos) << list.out;
    int lines = 0;
    for (char c : list.out) lines += c == '\n';
    EXPECT_EQ(lines, 9);

    std::string copy = dir_ / "copy.acl";
    rytest::write_file(copy, list.out);
    // Compiling lists sub-ACLs in reverse order of first appearance, so
    // compare the entries, not their order.
    EXPECT_EQ(sorted_lines(q({"-l", copy}).out), sorted_lines(list.out));
    for (std::vector<std::string> query : std::vector<std::vector<std::string>>{
             {"-n"}, {"-o"}, {"-i", "unix:alice@node1"}, {"-e", "unix:admins"}, {"-g", "staff,auditors"}}) {
        auto a = query, b = query;
        a.push_back(file_);
        b.push_back(copy);
        EXPECT_EQ(q(a).out, q(b).out) << query[0];
    }
    // The checker accepts the listing as it stands.
    auto check = rytest::run_ryaclfck({"-f", copy}, "", kEnv);
    EXPECT_EQ(check.status, 0) << check.err;
}

TEST_F(Ryaclq, WrongUsageGetsTheUsageAndNoAnswer) {
    const std::vector<std::vector<std::string>> bad = {
        {},
        {file_},
        {"--bogus", "-n", file_},
        {"-x", "-n", file_},
        {"-n"},
        {"-n", "-o", file_},
        {"-n", file_, "extra"},
        {"-i", "alice@node1", file_},
        {"-g", "staff,,guests", file_},
        {"-g", ",", file_},
        {"-g", "", file_},
        {"-u"},
        {"-u", "root", "-u", "root", "-n", file_},
        {"--identity"},
        {"--list=yes", file_},
    };
    for (const auto &args : bad) {
        auto r = q(args);
        std::string shown = args.empty() ? "(none)" : args[0];
        EXPECT_EQ(r.status, ACL_RC_BAD_ARGS) << shown;
        EXPECT_EQ(r.out, "") << shown;
        EXPECT_NE(r.err.find("Usage: ryaclq"), std::string::npos) << shown;
    }
    auto help = q({"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_EQ(help.out.rfind("Usage: ryaclq", 0), 0u);
    auto version = q({"-V"});
    EXPECT_EQ(version.status, 0);
    EXPECT_NE(version.out.find(RYACL_VERSION), std::string::npos);
}

TEST_F(Ryaclq, BadFilesAndUsersGetTheLibraryMessage) {
    expect_refusal(q({"-n", dir_ / "missing.acl"}), ACL_RC_FILE_ERROR, "4471-135");
    expect_refusal(q({"-n", dir_.path()}), ACL_RC_FILE_ERROR, "4471-135");
    struct faulty_file {
        std::string text;
        int status;
        const char *id;
    };
    const faulty_file faulty[] = {
        {"n r\nx rw\n", ACL_RC_BAD_ACL, "4471-179"},
        {"u unix\n", ACL_RC_BAD_ACL, "4471-172"},
        {"g staff rwz\n", ACL_RC_PERMISSION, "4471-180"},
        {"u unix alice r\nu UNIX Alice w\n", ACL_RC_BAD_ACLE, "4471-157"},
        {"o r\no w\n", ACL_RC_BAD_ACLE, "4471-174"},
        {std::string("n r\n\0o rw\n", 10), ACL_RC_BAD_ACL, "4471-144"},
    };
    for (const auto &f : faulty) {
        std::string path = dir_ / "faulty.acl";
        rytest::write_file(path, f.text);
        expect_refusal(q({"-o", path}), f.status, f.id);
        expect_refusal(q({"-l", path}), f.status, f.id);
    }
    expect_refusal(q({"-u", "no_such_user_ryaclq", "-n", "service.acl"}), ACL_RC_UNKNOWN_USER, "4471-140");
    expect_refusal(q({"-u", "root", "-n", file_}), ACL_RC_BAD_ARGS, "4471-165");
    expect_refusal(q({"-u", "", "-n", "service.acl"}), ACL_RC_BAD_ARGS, "4471-134");
}

TEST_F(Ryaclq, CacheIsWrittenUsedAndVerifiedOnRequest) {
    const std::string cache = file_ + ".cacl";
    auto w = q({"--write-cache", "--verbose", "-o", file_});
    EXPECT_EQ(w.out, grant("rl"));
    EXPECT_NE(w.err.find("compiled from the text; cache file written"), std::string::npos) << w.err;
    struct stat a, c;
    ASSERT_EQ(stat(file_.c_str(), &a), 0);
    ASSERT_EQ(stat(cache.c_str(), &c), 0);
    EXPECT_EQ(c.st_mode, a.st_mode);

    auto r = q({"-v", "-o", file_});
    EXPECT_EQ(r.out, grant("rl"));
    EXPECT_NE(r.err.find("came from the cache file\n"), std::string::npos) << r.err;
    r = q({"-v", "--verify-cache", "-o", file_});
    EXPECT_EQ(r.out, grant("rl"));
    EXPECT_NE(r.err.find("passed validation"), std::string::npos) << r.err;
    r = q({"-v", "--from-text", "-o", file_});
    EXPECT_EQ(r.out, grant("rl"));
    EXPECT_NE(r.err.find("compiled from the text; cache file not written"), std::string::npos) << r.err;
}

// A cache compiled from a more generous text answers only while it is
// current and matches the text file's mode; otherwise the text does.
TEST_F(Ryaclq, StaleOrMismatchedCacheNeverAnswers) {
    std::string generous = dir_ / "generous.acl";
    rytest::write_file(generous, "o rwcxCqledvsao\n", 0640);
    set_mtime(generous, -100);
    ASSERT_EQ(q({"-w", "-o", generous}).status, 0);
    const std::string bytes = rytest::read_file(generous + ".cacl");
    ASSERT_FALSE(bytes.empty());
    const std::string cache = file_ + ".cacl";

    rytest::write_file(cache, bytes, 0640);
    set_mtime_at(cache, mtime_of(file_) - 1);  // older than the text
    expect_answer(q({"-o", file_}), grant("rl"));

    set_mtime_at(cache, mtime_of(file_));  // the same second: still stale
    expect_answer(q({"-o", file_}), grant("rl"));

    rytest::write_file(cache, bytes, 0600);  // current, but another mode
    expect_answer(q({"-o", file_}), grant("rl"));

    // Current and matching: the library trusts it, as a service would.
    rytest::write_file(cache, bytes, 0640);
    expect_answer(q({"-o", file_}), grant("rwcxCqledvsao"));
    expect_answer(q({"-t", "-o", file_}), grant("rl"));
}

// Every truncation of a current cache is refused, and falls back to the text
// with --verify-cache; every byte flip is survived without a crash, with
// either a well-formed answer or the library's message and no answer.
TEST_F(Ryaclq, DamagedCacheGivesAnErrorNotAGrant) {
    std::string small = dir_ / "small.acl";
    rytest::write_file(small, "n r\no rl\nu unix alice rw\ng staff r\n", 0640);
    set_mtime(small, -100);
    ASSERT_EQ(q({"-w", "-n", small}).status, 0);
    const std::string cache = small + ".cacl";
    const std::string good = rytest::read_file(cache);
    ASSERT_GT(good.size(), 5u);
    const std::string from_text = q({"-t", "-l", small}).out;
    ASSERT_FALSE(from_text.empty());

    for (size_t len = 0; len < good.size(); ++len) {
        rytest::write_file(cache, good.substr(0, len), 0640);
        auto plain = q({"-l", small});
        auto verified = q({"-C", "-l", small});
        if (len == 0) {  // an empty cache file is passed over
            expect_answer(plain, from_text);
        } else {
            EXPECT_NE(plain.status, 0) << "length " << len;
            EXPECT_LT(plain.status, 128) << "length " << len;
            EXPECT_EQ(plain.out, "") << "length " << len;
            EXPECT_NE(plain.err.find("4471-"), std::string::npos) << "length " << len;
        }
        expect_answer(verified, from_text);
    }

    std::regex line("(n|o|g \\S+|u \\S+ \\S+|e \\S+ \\S+)( [A-Za-z?]+)? # 0x[0-9a-f]{8}\n");
    for (size_t i = 0; i < good.size(); ++i) {
        std::string bad = good;
        bad[i] = static_cast<char>(bad[i] ^ 0xff);
        rytest::write_file(cache, bad, 0640);
        const bool valid = passes_validation(bad);
        // An answer from these bytes only when the library accepts them.
        auto grant_n = q({"-n", small});
        ASSERT_LT(grant_n.status, 128) << "byte " << i << ": " << grant_n.err;
        if (!valid) {
            EXPECT_NE(grant_n.status, 0) << "byte " << i;
            expect_refusal(grant_n, grant_n.status, "4471-");
        }

        // Listings, with and without the library's check, alternately.
        const bool verify = i % 2 == 1;
        auto r = verify ? q({"-C", "-l", small}) : q({"-l", small});
        ASSERT_LT(r.status, 128) << "byte " << i << ": " << r.err;
        if (r.status == 0) {
            if (!valid) {
                EXPECT_EQ(r.out, from_text) << "byte " << i;  // fell back to the text
            }
            std::string rest = r.out;
            std::smatch m;
            while (std::regex_search(rest, m, line, std::regex_constants::match_continuous)) rest = m.suffix();
            EXPECT_EQ(rest, "") << "byte " << i << ": " << r.out;
        } else {
            EXPECT_FALSE(valid) << "byte " << i << ": " << r.err;
            EXPECT_EQ(r.out, "") << "byte " << i;
            EXPECT_NE(r.err.find("4471-"), std::string::npos) << "byte " << i << ": " << r.err;
        }
    }
}

}  // namespace
