// The compiled ACL cache file: contents and identity, refusal of a foreign
// or planted cache, name limits, temporary names that cannot be hijacked,
// and failures or crashes at every step leaving the old cache whole.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "ry_zo.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;
std::function<void(const std::string &, const std::string &)> g_step;
struct step_hook {
    explicit step_hook(std::function<void(const std::string &, const std::string &)> f) {
        g_step = std::move(f);
        acl__set_file_step_hook([](const char *s, const char *p) { g_step(s, p); });
    }
    ~step_hook() { acl__set_file_step_hook(nullptr); }
};

struct stat lstat_of(const std::string &p) {
    struct stat st {};
    EXPECT_EQ(lstat(p.c_str(), &st), 0) << p;
    return st;
}

// Leave the descriptor open on `path` unusable for every operation.
void break_fd_of(const std::string &path) {
    for (int fd = 3; fd < 1024; ++fd) {
        char link[64], target[4097] = {};
        snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
        if (readlink(link, target, sizeof target - 1) <= 0 || path != target) continue;
        int dead = open("/dev/null", O_PATH | O_CLOEXEC);
        dup2(dead, fd);
        close(dead);
    }
}

struct AclCache : ::testing::Test {
    rytest::tmp_dir d;
    std::string acl = d / "acl", cache = acl + ".cacl";
    std::string bytes = std::string("\x01\x00\x02", 3) + std::string(297, 'c');
    void SetUp() override { rytest::write_file(acl, "u:unix:joe:rw\n", 0640); }
    int32_t store(sec_boolean_t force = 1, const std::string &b = "new compiled ACL", const std::string &name = "") {
        sec_acl_buffer_desc desc{static_cast<int32_t>(b.size()), const_cast<char *>(b.data())};
        return sec__cache_aclbuffer((name.empty() ? acl : name).c_str(), &desc, force);
    }
    void expect_failed(int32_t rc, int32_t msg) {
        EXPECT_EQ(rc, 37);
        EXPECT_EQ(rytest::error_msgnum(), msg) << rytest::error_text();
    }
};

TEST_F(AclCache, WritesExactlyTheBytesWithTheAclFilesIdentity) {
    if (geteuid() == 0) { ASSERT_EQ(chown(acl.c_str(), 65534, 65534), 0); }
    sec_acl_buffer_desc none{0, nullptr};
    EXPECT_EQ(sec__cache_aclbuffer(acl.c_str(), &none, 1), 1);
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_EQ(rytest::list_dir(d.path()), strings{"acl"});
    ASSERT_EQ(store(1, bytes), 0);
    EXPECT_EQ(rytest::read_file(cache), bytes);
    struct stat a = lstat_of(acl), c = lstat_of(cache);
    EXPECT_TRUE(c.st_uid == a.st_uid && c.st_gid == a.st_gid && c.st_mode == a.st_mode);
    EXPECT_EQ(rytest::list_dir(d.path()), (strings{"acl", "acl.cacl"}));
}

TEST_F(AclCache, ExistingCacheIdentityAndAgeDecide) {
    rytest::write_file(cache, bytes, 0600);
    expect_failed(store(), 137);
    if (geteuid() == 0) {
        ASSERT_EQ(chmod(cache.c_str(), 0640) | chown(cache.c_str(), 65534, 0), 0);
        expect_failed(store(), 136);
    }
    EXPECT_EQ(rytest::read_file(cache), bytes);
    ASSERT_EQ(chmod(cache.c_str(), 0640) | chown(cache.c_str(), geteuid(), getegid()), 0);
    auto set_times = [&](long acl_ns, long cache_ns) {  // nanoseconds after a fixed second
        struct timespec t[2] = {{1700000000 + acl_ns / 1000000000, acl_ns % 1000000000}, {}};
        t[1] = t[0];
        ASSERT_EQ(utimensat(AT_FDCWD, acl.c_str(), t, 0), 0);
        t[0] = t[1] = {1700000000 + cache_ns / 1000000000, cache_ns % 1000000000};
        ASSERT_EQ(utimensat(AT_FDCWD, cache.c_str(), t, 0), 0);
    };
    set_times(900000000, 1000000000);  // cache in the next second
    zo_set_no_error_1();
    EXPECT_EQ(store(0), 1);
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_EQ(rytest::read_file(cache), bytes);
    EXPECT_EQ(store(1), 0);
    EXPECT_EQ(rytest::read_file(cache), "new compiled ACL");
    set_times(900000000, 100000000);  // same second
    EXPECT_EQ(store(0, bytes), 0);
    EXPECT_EQ(rytest::read_file(cache), bytes);
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
    strings tries;  // at the temporary names: skipped, four more digits each time
    size_t plant = 2;
    step_hook h([&](const std::string &s, const std::string &p) {
        if (s != "cache:open-tmp") return;
        tries.push_back(p);
        if (tries.size() <= plant) { EXPECT_EQ(symlink((d / (tries.size() % 2 ? "victim" : "ghost")).c_str(), p.c_str()), 0); }
    });
    ASSERT_EQ(store(), 0);
    ASSERT_EQ(tries.size(), 3u);
    for (size_t i = 0; i < tries.size(); ++i) {
        EXPECT_EQ(tries[i].substr(0, i ? tries[i - 1].size() : acl.size()), i ? tries[i - 1] : acl);
        std::string tail = tries[i].substr(acl.size());
        EXPECT_EQ(tail.size(), 5 + 4 * i);
        EXPECT_TRUE(tail[0] == '.' && tail.find_first_not_of("0123456789abcdef", 1) == std::string::npos) << tail;
    }
    EXPECT_EQ(rytest::read_file(d / "victim"), "precious");
    EXPECT_EQ(lstat_of(d / "victim").st_mode & 07777, 0600u);
    EXPECT_FALSE(rytest::file_exists(d / "ghost"));

    tries.clear();  // every name taken: a bounded number of tries, then 138
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

// With and without an existing cache: the step's message, no temporary
// left, the old cache whole.
TEST_F(AclCache, FailureAtAnyStepLeavesNoTemporaryAndTheOldCache) {
    struct rlimit saved;
    getrlimit(RLIMIT_FSIZE, &saved);
    signal(SIGXFSZ, SIG_IGN);
    struct { const char *step; int32_t msg; std::string text; } cases[] = {
        {"cache:write", 139, "only\n10 bytes out of a total of 16 bytes"},
        {"cache:fchmod", 142, "to 0x1a0"},
        {"cache:fsync", 139, "errno: " + std::to_string(EBADF)},
        {"cache:rename", 163, "Permanent CACL file: " + cache}};
    for (bool old : {false, true}) {
        for (auto &c : cases) {
            unlink(cache.c_str());
            if (old) { ASSERT_EQ(store(1, bytes), 0); }
            if (old && std::string(c.step) == "cache:rename") continue;  // needs the name free
            strings before = rytest::list_dir(d.path());
            step_hook h([&](const std::string &s, const std::string &p) {
                struct rlimit small = {10, saved.rlim_max};
                if (s != c.step) return;
                if (s == "cache:write") setrlimit(RLIMIT_FSIZE, &small);
                else if (s == "cache:rename") mkdir(cache.c_str(), 0700);
                else break_fd_of(p);
            });
            int32_t rc = store();
            setrlimit(RLIMIT_FSIZE, &saved);
            SCOPED_TRACE(c.step);
            expect_failed(rc, c.msg);
            EXPECT_NE(rytest::error_text().find(c.text), std::string::npos) << rytest::error_text();
            if (!old) rmdir(cache.c_str());
            EXPECT_EQ(rytest::list_dir(d.path()), before);
            if (old) { EXPECT_EQ(rytest::read_file(cache), bytes); }
        }
    }
    signal(SIGXFSZ, SIG_DFL);
}

TEST_F(AclCache, OwnerThatCannotBeGivenAwayIs141) {
    std::string name = acl;
    if (geteuid() != 0) {  // a directory owned by root stands in for a foreign ACL file
        if (lstat_of("/").st_uid == geteuid()) GTEST_SKIP() << "no foreign-owned file to point at";
        name = d / "foreign";
        ASSERT_EQ(symlink("/", name.c_str()), 0);
    }
    ASSERT_EQ(chmod(d.path().c_str(), 0777) | chmod(acl.c_str(), 0666), 0);
    for (bool old : {false, true}) {
        if (old && geteuid() != 0) break;
        if (old) { ASSERT_EQ(store(1, bytes), 0); }  // owned by root, writable by all
        strings before = rytest::list_dir(d.path());
        pid_t pid = fork();
        if (pid == 0) {  // root drops to nobody in the child only
            if (geteuid() == 0 && (setresgid(65534, 65534, 65534) || setresuid(65534, 65534, 65534))) _exit(254);
            if (access(d.path().c_str(), W_OK | X_OK) != 0) _exit(253);
            _exit(store(1, "other", name) == 37 ? rytest::error_msgnum() : 255);
        }
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        if (WEXITSTATUS(status) >= 253) GTEST_SKIP() << "cannot act as another user here";
        EXPECT_EQ(WEXITSTATUS(status), 141);
        EXPECT_EQ(rytest::list_dir(d.path()), before);
        if (old) { EXPECT_EQ(rytest::read_file(cache), bytes); }
    }
}

// A writer killed before any step leaves the old cache, or none, and
// nothing that stops the next writer.
TEST_F(AclCache, WriterKilledAtAnyStepLeavesOldOrNoCache) {
    for (bool old : {false, true}) {
        for (const char *step : {"cache:open", "cache:open-tmp", "cache:write", "cache:fchown", "cache:fchmod",
                                 "cache:fsync", "cache:close", "cache:rename"}) {
            unlink(cache.c_str());
            if (old) { ASSERT_EQ(store(1, bytes), 0); }
            pid_t pid = fork();
            if (pid == 0) {
                step_hook h([&](const std::string &s, const std::string &) { if (s == step) _exit(7); });
                _exit(store() == 0 ? 0 : 1);
            }
            int status = 0;
            ASSERT_EQ(waitpid(pid, &status, 0), pid);
            EXPECT_EQ(WEXITSTATUS(status), 7) << step;
            EXPECT_EQ(rytest::file_exists(cache), old) << step;
            if (old) { EXPECT_EQ(rytest::read_file(cache), bytes) << step; }
            EXPECT_EQ(store(), 0) << step << rytest::error_text();
        }
    }
}

}  // namespace
