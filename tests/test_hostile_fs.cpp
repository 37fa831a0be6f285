// A privileged writer and reader (this process, as root) working on ACL
// files in a directory that belongs to an unprivileged user, who plants
// symbolic links, hard links, FIFOs and devices at every name the library
// uses and swaps files between its checks.  A sentinel tree outside that
// directory stands for everything the user must not reach: it is hashed
// before and after and must never be written, truncated, chowned or
// chmodded.  Every run ends under an alarm, with its documented message.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "ry_zo.h"
#include "ryacl.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;
constexpr uid_t kNobody = 65534;

// Everything about a file that the victim's owner would miss: content,
// type, permissions, owner, group, size and modification time.  (Link
// counts and change times move when the planted links go; that is the
// attacker's doing.)
std::map<std::string, std::string> snapshot(const std::string &root) {
    std::map<std::string, std::string> m;
    std::vector<std::string> todo{root};
    while (!todo.empty()) {
        std::string p = todo.back();
        todo.pop_back();
        struct stat st {};
        if (lstat(p.c_str(), &st) != 0) continue;
        char meta[160];
        std::snprintf(meta, sizeof meta, "%o %u %u %lld %lld.%09ld", st.st_mode, st.st_uid, st.st_gid,
                      static_cast<long long>(st.st_size), static_cast<long long>(st.st_mtim.tv_sec), st.st_mtim.tv_nsec);
        m[p] = meta;
        if (S_ISREG(st.st_mode)) m[p] += "|" + rytest::read_file(p);
        if (S_ISDIR(st.st_mode))
            for (const std::string &n : rytest::list_dir(p)) todo.push_back(p + "/" + n);
    }
    return m;
}

std::string g_step_name;
std::function<void(const std::string &)> g_act;
void on_step(const char *step, const char *path) {
    if (g_act && g_step_name == step) {
        auto act = std::move(g_act);
        g_act = nullptr;
        act(path);
    }
}

struct HostileFs : ::testing::Test {
    rytest::tmp_dir top;
    std::string victims = top / "victims", home = top / "home";
    std::string acl = home + "/svc.acl", cache = acl + ".cacl";
    std::string victim = victims + "/shadow";
    std::map<std::string, std::string> before;
    const std::string text = "o r\ng staff rw\n";

    void SetUp() override {
        if (geteuid() != 0) GTEST_SKIP() << "needs root to act for a service in a user's directory";
        alarm(120);  // a hang fails the run
        ASSERT_EQ(mkdir(victims.c_str(), 0755) | mkdir((victims + "/etc").c_str(), 0700), 0);
        // A victim that would even parse as an ACL granting everything.
        rytest::write_file(victim, "o rwcxCqledvsao\n", 0600);
        rytest::write_file(victims + "/etc/config", "precious\n", 0644);
        ASSERT_EQ(mkdir(home.c_str(), 0755), 0);
        ASSERT_EQ(chown(home.c_str(), kNobody, kNobody), 0);
        rytest::write_file(acl, text, 0644);
        ASSERT_EQ(chown(acl.c_str(), kNobody, kNobody), 0);
        age(acl);
        before = snapshot(victims);
    }
    void TearDown() override {
        acl__set_file_step_hook(nullptr);
        g_act = nullptr;
        if (geteuid() == 0) {
            EXPECT_EQ(snapshot(victims), before) << "the sentinel tree changed";
        }
        alarm(0);
    }
    static void age(const std::string &p) {
        struct timespec t[2] = {{time(nullptr) - 1000, 0}, {time(nullptr) - 1000, 0}};
        utimensat(AT_FDCWD, p.c_str(), t, AT_SYMLINK_NOFOLLOW);
    }
    int32_t store(const std::string &name) {
        static const std::string bytes("\x85\x01\x02\x00\x00", 5);
        sec_acl_buffer_desc d{5, const_cast<char *>(bytes.data())};
        return sec__cache_aclbuffer(name.c_str(), &d, 1);
    }
    // sec_read_acl_file asked to use and to store the cache: what it
    // returns, its flags, and the compiled ACL's size.
    struct read_result {
        int32_t rc, msg;
        uint32_t rflags;
        int32_t length;
    };
    read_result read() {
        sec_buffer_desc got{0, nullptr};
        read_result r{};
        r.rc = sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_CONVERT_CACHE | SEC_ACLF_WRITE_CACHE, &got,
                                 &r.rflags);
        r.msg = rytest::error_msgnum();
        r.length = got.length;
        sec_release_acl(&got);
        return r;
    }
    // The checker, bounded in time.
    rytest::run_result check(const std::string &file, const std::vector<std::string> &env = {}) {
        return rytest::run({"/usr/bin/timeout", "60", RYACLFCK_PATH, "-s", "-f", file}, "", env);
    }
    void at_step(const char *step, std::function<void(const std::string &)> act) {
        g_step_name = step;
        g_act = std::move(act);
        acl__set_file_step_hook(on_step);
    }
};

TEST_F(HostileFs, LinksPlantedAtTheCacheName) {
    for (const std::string &target : {victim, victims + "/etc", std::string("/nonexistent/x")}) {
        SCOPED_TRACE(target);
        unlink(cache.c_str());
        ASSERT_EQ(symlink(target.c_str(), cache.c_str()), 0);
        EXPECT_EQ(store(acl), ACL_RC_FILE_ERROR);
        EXPECT_EQ(rytest::error_msgnum(), 138);
        rytest::run_result r = check(acl);
        EXPECT_EQ(r.status, ACL_RC_FILE_ERROR) << r.err;
        EXPECT_NE(r.err.find("4471-151"), std::string::npos) << r.err;
        // The reader passes over the link and, asked to store, leaves it.
        read_result rr = read();
        EXPECT_EQ(rr.rc, 0);
        EXPECT_EQ(rr.rflags, static_cast<uint32_t>(SEC_ACLF_FROM_TEXT));
        struct stat st {};
        EXPECT_TRUE(lstat(cache.c_str(), &st) == 0 && S_ISLNK(st.st_mode));
    }
    // A FIFO or a device node at the cache name is refused, not opened.
    unlink(cache.c_str());
    ASSERT_EQ(mkfifo(cache.c_str(), 0644), 0);
    EXPECT_EQ(store(acl), ACL_RC_FILE_ERROR);
    EXPECT_EQ(read().rflags, static_cast<uint32_t>(SEC_ACLF_FROM_TEXT));
    unlink(cache.c_str());
    ASSERT_EQ(mknod(cache.c_str(), S_IFCHR | 0644, makedev(1, 5)), 0);  // /dev/zero
    EXPECT_EQ(store(acl), ACL_RC_FILE_ERROR);
    EXPECT_EQ(rytest::list_dir(home), (strings{"svc.acl", "svc.acl.cacl"}));
}

// Every four-digit temporary name taken by a link to the victim: the
// writer skips them all and never follows one.
TEST_F(HostileFs, LinksPlantedAtEveryTemporaryName) {
    for (unsigned n = 0; n < 65536; ++n) {
        char name[32];
        std::snprintf(name, sizeof name, "/svc.acl.%04x", n);
        ASSERT_EQ(symlink(victim.c_str(), (home + name).c_str()), 0);
    }
    EXPECT_EQ(store(acl), 0) << rytest::error_text();
    rytest::run_result r = check(acl);
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(rytest::list_dir(home).size(), 65536u + 2);  // the links, the ACL file and its cache
    struct stat st {};
    ASSERT_EQ(lstat(cache.c_str(), &st), 0);
    EXPECT_TRUE(S_ISREG(st.st_mode) && st.st_uid == kNobody && (st.st_mode & 07777) == 0644);
}

// A hard link to the victim at the cache name: refused when its identity
// differs from the ACL file's; when it matches, replaced by the rename
// without a byte written to the victim.
TEST_F(HostileFs, HardLinkAtTheCacheName) {
    ASSERT_EQ(link(victim.c_str(), cache.c_str()), 0);
    EXPECT_EQ(store(acl), ACL_RC_FILE_ERROR);
    EXPECT_EQ(rytest::error_msgnum(), 136);
    EXPECT_EQ(read().rflags, static_cast<uint32_t>(SEC_ACLF_FROM_TEXT));
    unlink(cache.c_str());

    const std::string root_acl = home + "/root.acl";
    rytest::write_file(root_acl, text, 0600);  // the victim's owner and mode
    ASSERT_EQ(link(victim.c_str(), (root_acl + ".cacl").c_str()), 0);
    EXPECT_EQ(store(root_acl), 0);
    rytest::run_result r = check(root_acl);
    EXPECT_EQ(r.status, 0) << r.err;
    struct stat v {}, c {};
    ASSERT_EQ(stat(victim.c_str(), &v) | stat((root_acl + ".cacl").c_str(), &c), 0);
    EXPECT_NE(v.st_ino, c.st_ino);
}

// Names replaced by links to the victim between the writer's steps: the
// cache name, the temporary name (the user may rename the writer's
// temporary away in a directory of their own) and the ACL file itself.
TEST_F(HostileFs, NamesSwappedBetweenTheWritersSteps) {
    enum { CACHE, TEMPORARY, ACL_FILE };
    struct swap {
        const char *step;
        int which;
        bool old_cache;
        int32_t rc, msg;
    } swaps[] = {
        {"cache:open-write", CACHE, true, ACL_RC_FILE_ERROR, 138},  // not opened through the link
        {"cache:rename", CACHE, true, 0, 0},                          // the link is replaced, not followed
        {"cache:rename", CACHE, false, 0, 0},
        {"cache:write", TEMPORARY, false, 0, 0},  // the descriptor is written, not the name
        {"cache:fchown", TEMPORARY, false, 0, 0},
        {"cache:stat-acl", ACL_FILE, false, 0, 0},  // the cache takes the victim's identity, not its bytes
    };
    for (const swap &s : swaps) {
        SCOPED_TRACE(std::string(s.step) + " " + std::to_string(s.which));
        for (const std::string &n : rytest::list_dir(home)) unlink((home + "/" + n).c_str());
        rytest::write_file(acl, text, 0644);
        ASSERT_EQ(chown(acl.c_str(), kNobody, kNobody), 0);
        if (s.old_cache) {
            ASSERT_EQ(store(acl), 0);
        }
        at_step(s.step, [&](const std::string &path) {
            const std::string name = s.which == CACHE ? cache : s.which == ACL_FILE ? acl : path;
            if (rename(name.c_str(), (name + ".away").c_str()) != 0) {
                ASSERT_EQ(errno, ENOENT);  // no cache yet: the link is only planted
            }
            ASSERT_EQ(symlink(victim.c_str(), name.c_str()), 0);
        });
        EXPECT_EQ(store(acl), s.rc) << rytest::error_text();
        acl__set_file_step_hook(nullptr);
        if (s.msg) {
            EXPECT_EQ(rytest::error_msgnum(), s.msg);
        }
        EXPECT_FALSE(g_act) << "the step never came";
    }
}

// The ACL file swapped after the reader looked at it and before it opened
// it: a link to the victim, a FIFO, a link to /dev/zero, a huge sparse file.
// None of them is read; nothing is stored.
TEST_F(HostileFs, AclFileSwappedBetweenVettingAndOpening) {
    struct swap {
        const char *what;
        std::function<void()> make;
    } swaps[] = {
        {"link to the victim", [&] { ASSERT_EQ(symlink(victim.c_str(), acl.c_str()), 0); }},
        {"FIFO", [&] { ASSERT_EQ(mkfifo(acl.c_str(), 0644), 0); }},
        {"link to /dev/zero", [&] { ASSERT_EQ(symlink("/dev/zero", acl.c_str()), 0); }},
        {"huge sparse file", [&] {
             int fd = open(acl.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
             ASSERT_GE(fd, 0);
             ASSERT_EQ(ftruncate(fd, off_t{1} << 40), 0);
             close(fd);
         }},
    };
    for (const swap &s : swaps) {
        SCOPED_TRACE(s.what);
        unlink(acl.c_str());
        unlink(cache.c_str());
        rytest::write_file(acl, text, 0644);
        at_step("read:open", [&](const std::string &path) {
            if (path != acl) return;
            ASSERT_EQ(unlink(acl.c_str()), 0);
            s.make();
        });
        read_result r = read();
        acl__set_file_step_hook(nullptr);
        EXPECT_EQ(r.rc, ACL_RC_FILE_ERROR);
        EXPECT_EQ(r.msg, 122);
        EXPECT_EQ(r.length, 0);
        EXPECT_FALSE(rytest::file_exists(cache));
    }

    // The checker vets the name it is given and then the descriptor it
    // opens; it is run on each of them in place of the file.
    for (const swap &s : swaps) {
        SCOPED_TRACE(std::string("ryaclfck, ") + s.what);
        unlink(acl.c_str());
        s.make();
        rytest::run_result r = check(acl, {"ASAN_OPTIONS=allocator_may_return_null=1"});
        EXPECT_NE(r.status, 124) << "the check hung";
        if (std::string(s.what) == "huge sparse file") {
            EXPECT_EQ(r.status, ACL_RC_NO_MEMORY) << r.err;  // vetted: a regular file, too large to hold
        } else if (std::string(s.what) == "link to the victim") {
            // Named on the command line by root, a link is followed like any
            // other path.  The victim is only read, and its compiled form
            // is stored with the victim's owner and mode, unreadable to the
            // user.
            EXPECT_EQ(r.status, 0) << r.err;
            struct stat st {};
            ASSERT_EQ(lstat(cache.c_str(), &st), 0);
            EXPECT_TRUE(st.st_uid == 0 && (st.st_mode & 07777) == 0600);
            unlink(cache.c_str());
        } else {
            EXPECT_EQ(r.status, ACL_RC_BAD_FILE_NAME) << r.err;
            EXPECT_NE(r.err.find("4471-168"), std::string::npos) << r.err;
        }
        EXPECT_FALSE(rytest::file_exists(cache));
    }
}

}  // namespace
