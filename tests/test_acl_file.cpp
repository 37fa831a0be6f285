// The ACL file unit: name resolution within the 4097-byte area (guard bytes
// after it must survive), reading a file whole from its descriptor, and the
// cache writer (bytes, identity, freshness, name limit, planted links).
// (Cache writer failures at each step, killed writers: test_cache_faults,
// test_crash_consistency.)
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "ry_zo.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

struct resolver {
    char b[ACL_FNAME_AREA + 64];
    uid_t uid = 4242;
    int32_t operator()(const std::string &f, const char *user) {
        std::memset(b, 0x5a, sizeof b);
        int32_t rc = sec__get_aclfname(f.c_str(), user, b, &uid);
        for (size_t i = ACL_FNAME_AREA; i < sizeof b; ++i) EXPECT_EQ(b[i], 0x5a) << "overrun at " << i;
        return rc;
    }
    void fails(const std::string &f, const char *user, int32_t rc, int32_t msg) {
        EXPECT_EQ((*this)(f, user), rc) << f.substr(0, 20);
        EXPECT_EQ(rytest::error_msgnum(), msg);
    }
};

TEST(AclFname, NamesWithoutUserAndTheAreaLimit) {
    rytest::tmp_dir d;
    char old[ACL_FNAME_AREA], here[ACL_FNAME_AREA];
    ASSERT_TRUE(getcwd(old, sizeof old) && chdir(d.path().c_str()) == 0 && getcwd(here, sizeof here));
    resolver r;
    EXPECT_EQ(r("../acl", nullptr), 0);
    EXPECT_EQ(r.b, std::string(here) + "/../acl");
    size_t fit = 4096 - 1 - std::strlen(here);  // directory, separator, name: 4096
    EXPECT_EQ(r(std::string(fit, 'n'), nullptr), 0);
    EXPECT_EQ(std::strlen(r.b), 4096u);
    r.fails(std::string(fit + 1, 'n'), nullptr, 105, 153);
    std::string abs = "/x//./" + std::string(4090, 'x');
    EXPECT_EQ(r(abs, nullptr), 0);
    EXPECT_EQ(r.b, abs);
    r.fails(abs + "x", nullptr, 105, 153);
    ASSERT_EQ(chdir("/"), 0);
    EXPECT_EQ(r("acl", nullptr), 0);
    EXPECT_STREQ(r.b, "/acl");  // no doubled separator
    EXPECT_EQ(r.uid, 4242u);  // written only with a user
    ASSERT_EQ(chdir(old), 0);
}

TEST(AclFname, SimpleNameInTheUsersHome) {
    struct passwd *pw = getpwuid(geteuid());
    ASSERT_NE(pw, nullptr);
    std::string user = pw->pw_name, home = pw->pw_dir;
    uid_t want = pw->pw_uid;
    resolver r;
    EXPECT_EQ(r("acl", user.c_str()), 0);
    EXPECT_EQ(r.b, home + (home.back() == '/' ? "" : "/") + "acl");
    EXPECT_EQ(r.uid, want);
    size_t fit = 4096 - 1 - home.size();  // counted with the separator
    EXPECT_EQ(r(std::string(fit, 'n'), user.c_str()), 0);
    r.uid = 4242;
    r.fails(std::string(fit + 1, 'n'), user.c_str(), 4, 151);
    for (const char *bad : {"d/acl", "/etc/acl", "../acl", "acl/"}) r.fails(bad, user.c_str(), 4, 151);
    r.fails("acl", "", 15, 127);  // an empty user is unknown, not the caller
    EXPECT_EQ(r.uid, 4242u);  // no failure touched it

    char dir[ACL_FNAME_AREA];
    EXPECT_EQ(rytest::for_each_alloc_failure([&] { return sec__get_user_info(user.c_str(), &want, dir); },
                                             [&](int32_t rc, long) { EXPECT_TRUE(rc == 6 && rytest::error_msgnum() == 89); }),
              1);
}

std::function<void()> g_on_read;  // run before each read() of the reader

struct result {
    int32_t rc;
    bool cleared;      // no buffer and size 0
    std::string text;  // what was read, with the terminator
};
result read_fd(int fd, std::function<void()> on_read = {}) {
    g_on_read = std::move(on_read);
    acl__set_file_step_hook([](const char *s, const char *) { if (g_on_read && !std::strcmp(s, "read:read")) g_on_read(); });
    char junk, *buf = &junk;  // outputs must be overwritten whatever happens
    size_t size = 77;
    result r{acl__read_acl_file("acl", fd, &buf, &size), false, ""};
    acl__set_file_step_hook(nullptr);
    r.cleared = buf == nullptr && size == 0;
    if (buf && buf != &junk) r.text.assign(buf, size + 1);
    if (buf != &junk) std::free(buf);
    return r;
}
result read_path(const std::string &path, std::function<void()> on_read = {}) {
    int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK);
    result r = read_fd(fd, std::move(on_read));
    if (fd >= 0) close(fd);
    return r;
}

TEST(AclFileRead, WholeContentsWithNulBytesAndEmptyFileWithoutAllocating) {
    rytest::tmp_dir d;
    std::string body(70000, '\0');
    for (size_t i = 0; i < body.size(); ++i) body[i] = static_cast<char>(i % 251);
    rytest::write_file(d / "acl", body);
    result r = read_path(d / "acl");
    EXPECT_TRUE(r.rc == 0 && r.text == body + '\0');
    rytest::write_file(d / "empty", "");
    rytest::alloc_fail_nth(1);
    r = read_path(d / "empty");
    EXPECT_EQ(rytest::alloc_count(), 0);
    rytest::alloc_fail_none();
    EXPECT_TRUE(r.rc == 0 && r.cleared);
}

TEST(AclFileRead, ReadsTheOpenFileUpToItsSizeNotWhatTheNameBecomes) {
    rytest::tmp_dir d;
    rytest::write_file(d / "acl", "first\n");
    int fd = open((d / "acl").c_str(), O_RDONLY), grow = open((d / "acl").c_str(), O_WRONLY | O_APPEND);
    rytest::write_file(d / "other", "a much longer replacement\n");
    ASSERT_EQ(rename((d / "other").c_str(), (d / "acl").c_str()), 0);
    result r = read_fd(fd, [&] { (void)!write(grow, "more", 4); });
    EXPECT_TRUE(r.rc == 0 && r.text == std::string("first\n", 7)) << r.text;
    close(grow);
    close(fd);
}

TEST(AclFileRead, FailuresGiveTheirMessageAndNoBuffer) {
    rytest::tmp_dir d;
    ASSERT_EQ(mkfifo((d / "fifo").c_str(), 0600), 0);
    rytest::write_file(d / "acl", std::string(1000, 'a'));
    const struct { std::string path; int32_t msg; std::string shows; } cases[] = {
        {d / "missing", 122, "errno = " + std::to_string(EBADF)},  // the caller's open failed
        {d.path(), 122, ""},
        {d / "fifo", 122, ""},
        {d / "acl", 126, "only 400 bytes out of a total\nof 1000 bytes"},  // shrinks after the size is taken
    };
    for (const auto &c : cases) {
        result r = read_path(c.path, [&] { (void)!truncate(c.path.c_str(), 400); });
        EXPECT_TRUE(r.rc == 37 && r.cleared) << c.path;
        EXPECT_EQ(rytest::error_msgnum(), c.msg) << c.path;
        EXPECT_NE(rytest::error_text().find(c.shows), std::string::npos) << rytest::error_text();
    }
    rytest::write_file(d / "acl", std::string(300, 'a'));
    rytest::alloc_fail_nth(1);  // the one allocation: size and terminator
    result r = read_path(d / "acl");
    EXPECT_EQ(rytest::alloc_count(), 1);
    rytest::alloc_fail_none();
    EXPECT_TRUE(r.rc == 6 && r.cleared && rytest::error_msgnum() == 89);
    EXPECT_NE(rytest::error_text().find("Attempted allocation: 301 bytes"), std::string::npos);
}

using strings = std::vector<std::string>;
std::function<void(const std::string &)> g_on_tmp;  // each temporary name tried
struct stat lstat_of(const std::string &p) {
    struct stat st {};
    EXPECT_EQ(lstat(p.c_str(), &st), 0) << p;
    return st;
}

struct AclCache : ::testing::Test {
    rytest::tmp_dir d;
    std::string acl = d / "acl", cache = acl + ".cacl";
    std::string bytes = std::string("\x01\x00\x02", 3) + std::string(297, 'c');
    void SetUp() override {
        rytest::write_file(acl, "u:unix:joe:rw\n", 0640);
        zo_set_no_error_1();
    }
    void TearDown() override { acl__set_file_step_hook(nullptr); }
    int32_t store(sec_boolean_t force = 1, const std::string &b = "new compiled ACL", const std::string &name = "") {
        sec_acl_buffer_desc desc{static_cast<int32_t>(b.size()), const_cast<char *>(b.data())};
        return sec__cache_aclbuffer((name.empty() ? acl : name).c_str(), &desc, force);
    }
    void expect_failed(int32_t rc, int32_t msg) {
        EXPECT_EQ(rc, 37);
        EXPECT_EQ(rytest::error_msgnum(), msg) << rytest::error_text();
    }
};

TEST_F(AclCache, ExactBytesWithTheAclFilesIdentityOverAMatchingCacheOnly) {
    sec_acl_buffer_desc none{0, nullptr};
    EXPECT_EQ(sec__cache_aclbuffer(acl.c_str(), &none, 1), 1);  // nothing to store, no error
    EXPECT_TRUE(rytest::error_code() == 0 && rytest::list_dir(d.path()) == strings{"acl"});
    rytest::write_file(cache, bytes, 0600);
    expect_failed(store(), 137);  // another mode
    if (geteuid() == 0) {
        ASSERT_EQ(chmod(cache.c_str(), 0640) | chown(cache.c_str(), 65534, 0), 0);
        expect_failed(store(), 136);  // another owner
        ASSERT_EQ(chown(acl.c_str(), 65534, 65534) | chown(cache.c_str(), 65534, 65534), 0);
    }
    EXPECT_EQ(rytest::read_file(cache), bytes);
    ASSERT_EQ(chmod(cache.c_str(), 0640), 0);
    auto set_times = [&](long acl_ns, long cache_ns) {  // nanoseconds after a fixed second
        for (auto [p, ns] : {std::pair{&acl, acl_ns}, {&cache, cache_ns}}) {
            struct timespec t[2] = {{1700000000 + ns / 1000000000, ns % 1000000000}, {}};
            t[1] = t[0];
            ASSERT_EQ(utimensat(AT_FDCWD, p->c_str(), t, 0), 0);
        }
    };
    set_times(900000000, 1000000000);  // cache in the next second: fresh, kept unless forced
    zo_set_no_error_1();
    EXPECT_EQ(store(0), 1);
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_EQ(rytest::read_file(cache), bytes);
    EXPECT_EQ(store(1), 0);
    EXPECT_EQ(rytest::read_file(cache), "new compiled ACL");
    set_times(900000000, 100000000);  // same second: not known to be fresh
    EXPECT_EQ(store(0, bytes), 0);
    EXPECT_EQ(rytest::read_file(cache), bytes);
    struct stat a = lstat_of(acl), c = lstat_of(cache);
    EXPECT_TRUE(c.st_uid == a.st_uid && c.st_gid == a.st_gid && c.st_mode == a.st_mode);
    EXPECT_EQ(rytest::list_dir(d.path()), (strings{"acl", "acl.cacl"}));
}

TEST_F(AclCache, NameOf4089FitsAnd4090IsRefused) {
    std::string dir = d.path();
    while (4089 - dir.size() > 200) {
        dir += "/" + std::string(std::min<size_t>(200, 4089 - dir.size() - 150), 'd');
        ASSERT_EQ(mkdir(dir.c_str(), 0700), 0);
    }
    std::string name = dir + "/" + std::string(4089 - dir.size() - 1, 'a');
    rytest::write_file(name, "x");
    EXPECT_EQ(store(1, bytes, name), 0);
    EXPECT_EQ(rytest::read_file(name + ".cacl"), bytes);
    expect_failed(store(1, bytes, name + "a"), 135);
}

TEST_F(AclCache, PlantedLinksAreNeverFollowed) {
    rytest::write_file(d / "victim", "precious", 0600);
    for (const char *target : {"victim", "ghost"}) {  // at the cache name: 138, left alone
        unlink(cache.c_str());
        ASSERT_EQ(symlink((d / target).c_str(), cache.c_str()), 0);
        expect_failed(store(), 138);
        EXPECT_TRUE(S_ISLNK(lstat_of(cache).st_mode));
    }
    unlink(cache.c_str());
    strings tries;  // at the temporary names: skipped, four more hex digits each time
    size_t plant = 2;
    g_on_tmp = [&](const std::string &p) {
        tries.push_back(p);
        if (tries.size() <= plant) { EXPECT_EQ(symlink((d / (tries.size() % 2 ? "victim" : "ghost")).c_str(), p.c_str()), 0); }
    };
    acl__set_file_step_hook([](const char *s, const char *p) { if (std::string(s) == "cache:open-tmp") g_on_tmp(p); });
    ASSERT_EQ(store(), 0);
    ASSERT_EQ(tries.size(), 3u);
    for (size_t i = 0; i < tries.size(); ++i)
        EXPECT_TRUE(tries[i].size() == acl.size() + 5 + 4 * i && tries[i].rfind(i ? tries[i - 1] : acl + ".", 0) == 0 &&
                    tries[i].find_first_not_of("0123456789abcdef", acl.size() + 1) == std::string::npos)
            << tries[i];
    EXPECT_TRUE(rytest::read_file(d / "victim") == "precious" && (lstat_of(d / "victim").st_mode & 07777) == 0600);
    EXPECT_FALSE(rytest::file_exists(d / "ghost"));

    tries.clear();  // every name taken: a bounded number of tries, then 138 naming the last
    plant = 100;
    expect_failed(store(), 138);
    EXPECT_LE(tries.size(), 8u);
    EXPECT_NE(rytest::error_text().find(tries.back()), std::string::npos);
    EXPECT_EQ(rytest::list_dir(d.path()).size(), 5 + tries.size());  // acl, cache, victim, 2+n links

    std::string longacl = d / std::string(250, 'l');  // the second try no longer fits an entry
    rytest::write_file(longacl, "x");
    tries.clear();
    plant = 1;
    expect_failed(store(1, bytes, longacl), 138);
    EXPECT_EQ(tries.size(), 2u);
}

}  // namespace
