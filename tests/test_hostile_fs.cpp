// As root, ACL files in a directory of a user who plants links, FIFOs and devices at every
// name the library uses and swaps files between its checks: the sentinel tree never changes.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <functional>

#include "lib_acl_bytes.h"
#include "ryacl_acl_file.h"

// The library now reads a huge sparse file it is handed and fails for
// memory (89), as the checker does: an allocation too large is a failure to
// report, not a crash, under AddressSanitizer too.
extern "C" const char *__asan_default_options() { return "allocator_may_return_null=1"; }

namespace {

using strings = std::vector<std::string>;
constexpr uid_t kNobody = 65534;

// Each name's type, mode, owner, group, size and time (links move the rest), then the bytes.
std::string snapshot(const std::string &root) {
    return rytest::run({"/usr/bin/find", root, "-printf", "%p %y %m %U %G %s %T@\n", "-type", "f", "-exec", "cat", "{}", "+"})
        .out;
}

std::string g_step, g_path;
std::function<void(const std::string &)> g_act;
void on_step(const char *step, const char *path) {
    if (g_act && g_step == step && (g_path.empty() || g_path == path)) std::exchange(g_act, nullptr)(path);
}

struct HostileFs : ::testing::Test {
    rytest::tmp_dir top;
    std::string victims = top / "victims", victim = victims + "/shadow", home = top / "home", acl = home + "/svc.acl",
                cache = acl + ".cacl", before;
    const std::string text = "o r\ng staff rw\n";

    void SetUp() override {
        if (geteuid() != 0) GTEST_SKIP() << "needs root to act for a service in a user's directory";
        alarm(120);
        ASSERT_EQ(mkdir(victims.c_str(), 0755) | mkdir((victims + "/etc").c_str(), 0700) | mkdir(home.c_str(), 0755), 0);
        rytest::write_file(victim, "o rwcxCqledvsao\n", 0600), rytest::write_file(victims + "/etc/config", "precious\n");
        before = snapshot(victims);
        ASSERT_EQ(chown(home.c_str(), kNobody, kNobody), 0);
        user_file(acl, text, 1000);
    }
    void TearDown() override {
        acl__set_file_step_hook(nullptr);
        EXPECT_TRUE(geteuid() != 0 || snapshot(victims) == before) << "the sentinel tree changed";
        alarm(0);
    }
    static void user_file(const std::string &p, const std::string &content, int age) {  // `age` seconds old
        rytest::write_file(p, content, 0644);
        struct timespec t[2] = {{time(nullptr) - age, 0}, {time(nullptr) - age, 0}};
        ASSERT_EQ(chown(p.c_str(), kNobody, kNobody) | utimensat(AT_FDCWD, p.c_str(), t, 0), 0);
    }
    static int32_t store(const std::string &name) {
        return sec__cache_aclbuffer(name.c_str(), std::array{sec_acl_buffer_desc{5, const_cast<char *>("\x85\1\2\0\0")}}.data(), 1);
    }
    struct read_result { int32_t rc, msg; uint32_t rflags; libtest::bytes acl; };
    read_result read() {  // asked to use and to store the cache
        sec_buffer_desc got{0, nullptr};
        read_result r{};
        r.rc = sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_CONVERT_CACHE | SEC_ACLF_WRITE_CACHE, &got, &r.rflags);
        r.msg = rytest::error_msgnum(), r.acl = libtest::view(got), sec_release_acl(&got);
        return r;
    }
    static void at_step(const char *step, const std::string &path, std::function<void(const std::string &)> act) {
        g_step = step, g_path = path, g_act = std::move(act);
        acl__set_file_step_hook(on_step);
    }
};

// At the cache name: refused by the writer (138: a link; 136: another owner), passed over by the
// reader, left in place.  At every four-digit temporary name: skipped.
TEST_F(HostileFs, PlantedNamesAreNeverFollowed) {
    const struct { std::function<int()> plant; int32_t msg; } rows[] = {
        {[&] { return symlink(victim.c_str(), cache.c_str()); }, 138},
        {[&] { return symlink((victims + "/etc").c_str(), cache.c_str()); }, 138},
        {[&] { return symlink("/nonexistent/x", cache.c_str()); }, 138},
        {[&] { return mkfifo(cache.c_str(), 0644); }, 136},                         // never opened
        {[&] { return mknod(cache.c_str(), S_IFCHR | 0644, makedev(1, 5)); }, 136},  // /dev/zero
        {[&] { return link(victim.c_str(), cache.c_str()); }, 136},
    };
    for (const auto &r : rows) {
        struct stat planted {}, now {};
        unlink(cache.c_str());
        ASSERT_EQ(r.plant() | lstat(cache.c_str(), &planted), 0);
        EXPECT_TRUE(store(acl) == ACL_RC_FILE_ERROR && rytest::error_msgnum() == r.msg) << rytest::error_text();
        const read_result rr = read();
        EXPECT_TRUE(rr.rc == 0 && rr.rflags == SEC_ACLF_FROM_TEXT && lstat(cache.c_str(), &now) == 0 &&
                    now.st_ino == planted.st_ino && now.st_mode == planted.st_mode);
        EXPECT_EQ(rytest::list_dir(home), (strings{"svc.acl", "svc.acl.cacl"}));
    }
    unlink(cache.c_str());
    char name[8];
    for (unsigned n = 0; n < 65536; ++n) {
        std::snprintf(name, sizeof name, ".%04x", n);
        ASSERT_EQ(symlink(victim.c_str(), (acl + name).c_str()), 0);
    }
    EXPECT_EQ(store(acl), 0) << rytest::error_text();
    EXPECT_EQ(rytest::run_ryaclfck({"-s", "-f", acl}).status, 0);
    EXPECT_EQ(rytest::list_dir(home).size(), 65536u + 2);  // the links, the ACL file and its cache
    struct stat st {};
    EXPECT_TRUE(lstat(cache.c_str(), &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == kNobody && (st.st_mode & 07777) == 0644);
}

// Names replaced by links to the victim between the writer's steps, and between the reader's.
TEST_F(HostileFs, NamesSwappedBetweenChecks) {
    enum { CACHE, TEMPORARY, ACL_FILE };
    const struct { const char *step; int which; bool old_cache; int32_t rc, msg; } swaps[] = {
        {"cache:open-write", CACHE, true, ACL_RC_FILE_ERROR, 138},  // not opened through the link
        {"cache:rename", CACHE, true, 0, 0}, {"cache:rename", CACHE, false, 0, 0},  // the link replaced, not followed
        {"cache:write", TEMPORARY, false, 0, 0}, {"cache:fchown", TEMPORARY, false, 0, 0},  // the descriptor written
        {"cache:stat-acl", ACL_FILE, false, 0, 0},  // the cache takes the victim's identity, not its bytes
    };
    for (const auto &s : swaps) {
        for (const std::string &n : rytest::list_dir(home)) unlink((home + "/" + n).c_str());
        user_file(acl, text, 1000);
        ASSERT_EQ(s.old_cache ? store(acl) : 0, 0);
        at_step(s.step, "", [&](const std::string &path) {
            const std::string name = s.which == CACHE ? cache : s.which == ACL_FILE ? acl : path;
            EXPECT_TRUE(rename(name.c_str(), (name + ".away").c_str()) == 0 || errno == ENOENT);  // no cache yet
            EXPECT_EQ(symlink(victim.c_str(), name.c_str()), 0);
        });
        EXPECT_TRUE(store(acl) == s.rc && (!s.msg || rytest::error_msgnum() == s.msg) && !g_act) << s.step << s.which;
    }

    // The ACL file swapped just before the readers open it: what is opened is vetted.  A FIFO or
    // /dev/zero is refused, the sparse file too large, a link followed (root named it) by both.
    for (const std::string &n : rytest::list_dir(home)) unlink((home + "/" + n).c_str());
    const struct { const char *what; std::function<int()> make; int status; } files[] = {
        {"link to the victim", [&] { return symlink(victim.c_str(), acl.c_str()); }, 0},
        {"FIFO", [&] { return mkfifo(acl.c_str(), 0644); }, ACL_RC_BAD_FILE_NAME},
        {"link to /dev/zero", [&] { return symlink("/dev/zero", acl.c_str()); }, ACL_RC_BAD_FILE_NAME},
        {"huge sparse file", [&] { return rytest::write_file(acl, ""), truncate(acl.c_str(), off_t{1} << 40); },
         ACL_RC_NO_MEMORY},
    };
    for (const auto &s : files) {
        rytest::write_file(acl, text, 0644);
        at_step("read:open", acl, [&](const std::string &) { EXPECT_EQ(unlink(acl.c_str()) | s.make(), 0); });
        const read_result r = read();
        const int32_t want = s.status == ACL_RC_BAD_FILE_NAME ? ACL_RC_FILE_ERROR : s.status;
        EXPECT_TRUE(r.rc == want && (!want || r.msg == (want == ACL_RC_FILE_ERROR ? 122 : 89)) &&
                    r.acl.empty() == (want != 0)) << s.what << r.rc;
        unlink(cache.c_str());
        g_act = nullptr;
        const rytest::run_result c = rytest::run({"/usr/bin/timeout", "60", RYACLFCK_PATH, "-s", "-f", acl}, "",
                                                 {"ASAN_OPTIONS=allocator_may_return_null=1"});
        struct stat st {};
        const bool stored = lstat(cache.c_str(), &st) == 0;
        const bool shown = s.status != ACL_RC_BAD_FILE_NAME || c.err.find("4471-168") != std::string::npos;
        EXPECT_TRUE(c.status == s.status && shown) << s.what << c.err;
        EXPECT_TRUE(stored == (s.status == 0) && (!stored || (st.st_uid == 0 && (st.st_mode & 07777) == 0600))) << s.what;
        unlink(acl.c_str()), unlink(cache.c_str());
    }
}

}  // namespace

namespace {

// A file whose bytes would drive the terminal: its entry type in message
// 165 and, under -v, its identifiers show control characters as \xNN and
// everything printable, UTF-8 included, as it is.
TEST(HostileText, ControlCharactersInAFileNeverReachTheTerminalRaw) {
    rytest::tmp_dir d;
    rytest::write_file(d / "bad.acl", "o r\n\x1b[2J r\n");
    auto r = rytest::run_ryaclfck({"-f", d / "bad.acl"}, "", {"LC_ALL=C.UTF-8", "NLSPATH"});
    EXPECT_NE(r.err.find("valid\nACLE type (\\x1b[2J)."), std::string::npos) << r.err;
    EXPECT_EQ(r.err.find('\x1b'), std::string::npos);
    rytest::write_file(d / "ids.acl", "u unix a\x07\x7f" "b r\ng jos\xc3\xa9\x01 r\n");
    r = rytest::run_ryaclfck({"-v", "-f", d / "ids.acl"}, "", {"LC_ALL=C.UTF-8", "NLSPATH"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.err.find("id = a\\x07\\x7fb;"), std::string::npos) << r.err;
    EXPECT_NE(r.err.find("id = jos\xc3\xa9\\x01;"), std::string::npos) << r.err;
    EXPECT_EQ(r.err.find_first_of("\x01\x07\x7f"), std::string::npos);
}

}  // namespace
