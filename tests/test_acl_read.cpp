// Reading an ACL file from its cache or its text (faults, swaps, allocation failures: test_cache_faults and others).
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include "lib_acl_bytes.h"
#include "ryacl_acl_file.h"

namespace {

using namespace libtest;

const char kText[] = "# sample\no r\nu unix bob rw\nu unix Alice r\n";
// What kText compiles to: sub-ACLs in reverse order of first appearance.
const bytes kCompiled = make_acl({subacl(4, "unix", {{1, "Alice"}, {3, "bob"}}), subacl(2, "", {{1, ""}})});
const bytes kMarker = make_acl({subacl(1, "", {{7, ""}})});  // a cache told apart by its contents
std::string str(const bytes &b) { return std::string(b.begin(), b.end()); }

struct result { std::string rc; uint32_t rflags; bytes acl; };
struct fixture {
    rytest::tmp_dir dir;
    std::string acl = dir / "svc.acl", cacl = acl + ".cacl";
    time_t now = time(nullptr);
    explicit fixture(const std::string &text = kText) { put(acl, text, 100, 0644); }
    void put(const std::string &path, const std::string &content, time_t age, mode_t mode) {
        rytest::write_file(path, content, mode);
        struct timespec ts[2] = {{now - age, 0}, {now - age, 0}};
        ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), ts, 0), 0) << path;
    }
    void cache(const bytes &b, time_t age = 10, mode_t mode = 0644) { put(cacl, str(b), age, mode); }
    // A failure leaves the empty descriptor.
    result read(uint32_t flags, const std::string &name = "", const char *user = nullptr) {
        sec_buffer_desc d{-1, reinterpret_cast<void *>(0x1)};
        uint32_t rflags = 0xdead;
        const int32_t rc = sec_read_acl_file((name.empty() ? acl : name).c_str(), user, nullptr, flags, &d, &rflags);
        result r{std::to_string(rc) + "/" + std::to_string(rytest::error_msgnum()), rflags, view(d)};
        EXPECT_TRUE(rc == 0 ? (d.length == 0) == (d.value == nullptr) : d.length == 0 && d.value == nullptr) << r.rc;
        if (d.value) sec_release_acl(&d);
        return r;
    }
};

// The cache serves when newer than the text, with its owner, group and mode, and not empty (verified with 0x4); else
// the text is compiled (0x1 returned) and, asked with 0x2, stored over a stale cache of the same identity (0x2
// returned).  Unknown bits come back as given; an empty text is not even looked at.
TEST(ReadFile, CacheUsedOnlyWhenCurrentAndMatching) {
    const bytes garbage = {0x85, 1, 2, 1, 0, 9}, none;
    const struct { const char *what; uint32_t flags; bytes cache; time_t age; mode_t mode; uint32_t rflags; bytes want;
                   uid_t owner = 0; const char *text = kText, *rc = "0/0"; } rows[] = {
        {"no cache", 0, none, -1, 0, 1, kCompiled},
        {"no cache, stored", 0x106, none, -1, 0, 0x103, kCompiled},
        {"used with 0x4", 4, kMarker, 10, 0644, 4, kMarker},
        {"reversed, converted", 4, reversed(kMarker), 10, 0644, 4, kMarker},
        {"same second is stale", 4, kMarker, 100, 0644, 1, kCompiled},
        {"mode differs", 4, kMarker, 10, 0640, 1, kCompiled},
        {"owner differs", 4, kMarker, 10, 0644, 1, kCompiled, 4242},
        {"empty cache", 4, none, 10, 0644, 1, kCompiled},
        {"fails verification", 4, garbage, 10, 0644, 1, kCompiled},
        {"unverified bytes as they are", 0, garbage, 10, 0644, 0, garbage},
        {"text asked for", 1, kMarker, 10, 0644, 1, kCompiled},
        {"0x1|0x2 with a newer cache", 3, kMarker, 10, 0644, 1, kCompiled},
        {"0x2 with a mismatched cache", 2, kMarker, 10, 0600, 1, kCompiled},
        {"0x2 with a stale cache", 2, kMarker, 200, 0644, 3, kCompiled},
        {"0x2 with a cache of the same second", 2, kMarker, 100, 0644, 3, kCompiled},
        {"empty text", 0x42, kMarker, 10, 0644, 0x42, none, 0, ""},
        {"comments only", 2, none, -1, 0, 1, none, 0, "# only\n\n   # comments\n"},
        {"a line that does not parse", 2, none, -1, 0, 3, none, 0, "o r\nq bad line\n", "42/165"},
    };
    for (const auto &r : rows) {
        fixture f(r.text);
        if (r.age >= 0) f.cache(r.cache, r.age, r.mode);
        ASSERT_TRUE(!r.owner || chown(f.cacl.c_str(), r.owner, static_cast<gid_t>(-1)) == 0);
        const result got = f.read(r.flags);
        EXPECT_TRUE(got.rc == r.rc && got.rflags == r.rflags && got.acl == r.want) << r.what << " " << got.rc << " " << got.rflags;
        const bool stored = r.rflags & SEC_ACLF_WRITE_CACHE && !r.want.empty();
        EXPECT_EQ(rytest::read_file(f.cacl), str(stored ? kCompiled : r.cache)) << r.what;
        EXPECT_TRUE(!stored || f.read(SEC_ACLF_WRITE_CACHE).rflags == 0) << r.what;  // and serves next
    }
}

// A cache swapped in after the look, alike in all but identity, is never read (text files: test_hostile_fs).
TEST(ReadFile, CacheReplacedBetweenLookAndOpen) {
    static std::string target, swap_in;
    acl__set_file_step_hook([](const char *step, const char *path) {
        if (std::string(step) == "read:open" && target == path) (void)!rename(swap_in.c_str(), path);
    });
    fixture f;
    f.cache(kMarker);
    target = f.cacl;
    swap_in = f.dir / "other";
    f.put(swap_in, std::string(5, '\0'), 10, 0644);
    const result r = f.read(0);
    acl__set_file_step_hook(nullptr);
    EXPECT_TRUE(r.rc == "0/0" && r.rflags == SEC_ACLF_FROM_TEXT && r.acl == kCompiled) << r.rc;
}

// What is not a regular file, or is not there, is refused by the lookup's message (122), not the open's (124).
TEST(ReadFile, DirectoryFifoAndMissingFileAreLookupFailures) {
    fixture f;
    ASSERT_EQ(mkdir((f.dir / "d").c_str(), 0755) | mkfifo((f.dir / "p").c_str(), 0644), 0);
    for (const char *name : {"d", "p", "missing"}) {
        for (uint32_t flags : {0u, uint32_t{SEC_ACLF_FROM_TEXT}}) EXPECT_EQ(f.read(flags, f.dir / name).rc, "37/122") << name;
        EXPECT_NE(rytest::error_text().find("(" + f.dir / name + ")"), std::string::npos) << rytest::error_text();
    }
}

// With a user: a simple name in that user's home, owned by the user and writable by no one else.
TEST(ReadFile, UsersFileMustBeTheirsAndWritableOnlyByThem) {
    const passwd *pw = getpwuid(geteuid());
    if (!pw || access(pw->pw_dir, W_OK) != 0 || std::string(pw->pw_dir) == "/") GTEST_SKIP() << "no usable home";
    const std::string user = pw->pw_name, base = ".ryacl-read-" + std::to_string(getpid()), path = pw->pw_dir + ("/" + base);
    fixture f;
    rytest::write_file(path, kText, 0644);
    EXPECT_EQ(f.read(SEC_ACLF_FROM_TEXT, base, user.c_str()).acl, kCompiled);
    for (int bad : {0664, 0646, geteuid() == 0 ? -1 : 0664}) {  // group, others, someone else's
        ASSERT_EQ(bad < 0 ? chmod(path.c_str(), 0644) | chown(path.c_str(), 65534, 65534) : chmod(path.c_str(), mode_t(bad)), 0);
        EXPECT_EQ(f.read(0, base, user.c_str()).rc, "36/128") << bad;
    }
    unlink(path.c_str());
}

}  // namespace
