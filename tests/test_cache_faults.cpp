// File system faults made real: at a step of the cache writer or reader, a
// child process makes system calls of one kind fail with a chosen errno.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstring>
#include <functional>

#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;
using calls = std::vector<long>;

#if defined(__x86_64__)
constexpr uint32_t kArch = AUDIT_ARCH_X86_64;
#elif defined(__aarch64__)
constexpr uint32_t kArch = AUDIT_ARCH_AARCH64;
#else
constexpr uint32_t kArch = 0;  // no filter built for this architecture
#endif

// The system calls behind each library call, as glibc may issue them.
#ifdef __NR_stat
const calls kStat{__NR_stat, __NR_newfstatat, __NR_statx, __NR_fstat}, kOpen{__NR_open, __NR_openat},
    kRename{__NR_rename, __NR_renameat, __NR_renameat2}, kUnlink{__NR_unlink, __NR_unlinkat};
#else
const calls kStat{__NR_newfstatat, __NR_statx, __NR_fstat}, kOpen{__NR_openat}, kRename{__NR_renameat, __NR_renameat2},
    kUnlink{__NR_unlinkat};
#endif

// From now on `nrs` fail with `err` (0: return 0, doing nothing).
void fail_syscalls(const calls &nrs, int err) {
    std::vector<sock_filter> f{BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch)),
                               BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArch, 1, 0), BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
                               BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr))};
    for (long nr : nrs) {
        f.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, static_cast<uint32_t>(nr), 0, 1));
        f.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | (static_cast<uint32_t>(err) & SECCOMP_RET_DATA)));
    }
    f.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
    sock_fprog prog{static_cast<unsigned short>(f.size()), f.data()};
    if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 || prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &prog) != 0) _exit(90);
}

// A child's report, in shared memory: no filter can stop it.  hits: the times the step came.
struct outcome { int32_t rc, code, msg; uint32_t rflags; int hits; char text[4096]; };
auto *const g_out = static_cast<outcome *>(
    mmap(nullptr, sizeof(outcome), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
std::string g_step, g_path;
std::function<void(const std::string &)> g_act;
void on_step(const char *step, const char *path) {
    if (g_step == step && (g_path.empty() || g_path == path) && !g_out->hits++) g_act(path);
}

// `body` in a child, with `act` done at the first `step` (on `path` when given).
outcome in_child(const char *step, const std::string &path, std::function<void(const std::string &)> act,
                 const std::function<int32_t()> &body) {
    *g_out = outcome{-1, 0, 0, 0, 0, {}};
    g_step = step, g_path = path, g_act = std::move(act);
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(30);
        acl__set_file_step_hook(on_step);
        g_out->rc = body();
        g_out->code = rytest::error_code(), g_out->msg = rytest::error_msgnum();
        std::snprintf(g_out->text, sizeof g_out->text, "%s", rytest::error_text().c_str());
        _exit(0);
    }
    int status = -1;
    EXPECT_TRUE(waitpid(pid, &status, 0) == pid && status == 0) << "the child was stopped: " << status;
    return *g_out;
}

// No nrs: a size limit (the kernel writes part).  no_unlink: the first failure is still the one reported.
struct fault { const char *step; calls nrs; std::vector<int> errs; int32_t msg; const char *shows; bool no_unlink = false; };
const fault kFaults[] = {
    {"cache:stat-acl", kStat, {EACCES, EIO, ELOOP}, 122, "svc.acl)"},
    {"cache:open", kOpen, {EACCES, ENOTDIR, EIO}, 122, "svc.acl)"},
    {"cache:open-write", kOpen, {EACCES, EROFS, ETXTBSY}, 138, "svc.acl.cacl)"},
    {"cache:open-tmp", kOpen, {ENOSPC, EDQUOT, EROFS, EMFILE, EEXIST}, 138, "svc.acl."},
    {"cache:write", {__NR_write}, {ENOSPC, EDQUOT, EIO, EFBIG, 0}, 139, "only\n0 bytes out of a total of 4005"},
    {"cache:write", {}, {EFBIG}, 139, "only\n1000 bytes out of a total of 4005"},
    {"cache:fchown", {__NR_fchown, __NR_fchownat}, {EPERM, EROFS}, 141, "to user id"},
    {"cache:fchmod", {__NR_fchmod, __NR_fchmodat}, {EPERM, EROFS}, 142, "to 0x1a0"},
    {"cache:fchmod", {__NR_fchmod, __NR_fchmodat}, {EROFS}, 142, "to 0x1a0", true},
    {"cache:fsync", {__NR_fsync, __NR_fdatasync}, {EIO, ENOSPC, EDQUOT}, 139, "only\n4005 bytes out of a total of 4005"},
    {"cache:close", {__NR_close}, {EIO, ENOSPC}, 139, "only\n4005 bytes"},
    {"cache:rename", kRename, {EXDEV, EACCES, EBUSY, ENOSPC, EMLINK, EROFS}, 163, "Permanent CACL file"},
};
void inject(const fault &f, int err) {
    if (f.no_unlink) fail_syscalls(kUnlink, err);
    if (!f.nrs.empty()) return fail_syscalls(f.nrs, err);
    struct rlimit small {};
    signal(SIGXFSZ, SIG_IGN), getrlimit(RLIMIT_FSIZE, &small), small.rlim_cur = 1000, setrlimit(RLIMIT_FSIZE, &small);
}

std::string fingerprint(const std::string &p) {  // bytes and identity
    struct stat st {};
    std::string s = lstat(p.c_str(), &st) ? "absent" : rytest::read_file(p);
    for (long v : {long(st.st_ino), long(st.st_mode), long(st.st_uid), st.st_mtim.tv_sec, st.st_mtim.tv_nsec})
        s += " " + std::to_string(v);
    return s;
}

int32_t store(const std::string &acl, std::string bytes) {
    return sec__cache_aclbuffer(acl.c_str(), std::array{sec_acl_buffer_desc{int32_t(bytes.size()), bytes.data()}}.data(), 1);
}

struct CacheFaults : ::testing::Test {
    rytest::tmp_dir d;
    std::string acl = d / "svc.acl", cache = acl + ".cacl";
    const std::string old_bytes{"\x85\x01\x02\x00\x00", 5};
    const std::string new_bytes = std::string("\x85\x01\x02\x01\x00", 5) + std::string(4000, 'n');
    void SetUp() override {
        if (!kArch) GTEST_SKIP() << "no seccomp filter for this architecture";
        rytest::write_file(acl, "o r\ng staff rw\n", 0640);
    }
};

// Each failure, with and without a cache, gives its message, leaves the cache as it was and no temporary.
TEST_F(CacheFaults, WriterFailingOrMovedAtEachStepKeepsTheOldCacheAndNoTemporary) {
    for (bool old : {false, true}) {
        ASSERT_EQ(old ? store(acl, old_bytes) : 0, 0);
        const std::string was = fingerprint(cache);
        const strings files = old ? strings{"svc.acl", "svc.acl.cacl"} : strings{"svc.acl"};
        for (const fault &f : kFaults)
            for (int err : f.errs) {
                if (!old && std::strcmp(f.step, "cache:open-write") == 0) continue;  // only an existing cache is opened
                const std::string what = std::string(f.step) + " errno " + std::to_string(err) + (old ? " over a cache" : "");
                outcome o = in_child(f.step, "", [&](const std::string &) { inject(f, err); }, [&] { return store(acl, new_bytes); });
                ASSERT_GT(o.hits, 0) << what;
                const std::string shown = (f.msg == 122 ? "errno = " : "errno: ") + std::to_string(err);
                const bool with_errno = f.msg == 122 || (f.msg == 139 && (std::strcmp(f.step, "cache:write") || f.nrs.empty()));
                EXPECT_TRUE(o.rc == ACL_RC_FILE_ERROR && o.msg == f.msg && std::strstr(o.text, f.shows) &&
                            (!with_errno || std::strstr(o.text, shown.c_str()))) << what << "\n" << o.text;
                const strings after = rytest::list_dir(d.path());
                EXPECT_EQ(after.size(), files.size() + f.no_unlink) << what;
                for (const std::string &n : after)
                    if (f.no_unlink && n != "svc.acl" && n != "svc.acl.cacl") unlink((d / n).c_str());
                EXPECT_TRUE(rytest::list_dir(d.path()) == files && fingerprint(cache) == was) << what;
            }
    }
    // The directory moved away and replaced: the writer finishes or fails where it started.
    for (const char *step :
         {"cache:open-tmp", "cache:write", "cache:fchown", "cache:fchmod", "cache:fsync", "cache:close", "cache:rename"}) {
        rytest::tmp_dir outer;
        const std::string dir = outer / "d", a = dir + "/svc.acl", moved = outer / "moved";
        ASSERT_EQ(mkdir(dir.c_str(), 0755), 0);
        rytest::write_file(a, "o r\n", 0640);
        ASSERT_EQ(store(a, old_bytes), 0);
        const std::string was = fingerprint(a + ".cacl");
        outcome r = in_child(step, "", [&](const std::string &) {
            if (rename(dir.c_str(), moved.c_str()) != 0 || mkdir(dir.c_str(), 0755) != 0) _exit(91);
        }, [&] { return store(a, new_bytes); });
        ASSERT_EQ(r.hits, 1) << step;
        EXPECT_TRUE(rytest::list_dir(moved) == (strings{"svc.acl", "svc.acl.cacl"}) && rytest::list_dir(dir).empty()) << step;
        const std::string now = fingerprint(moved + "/svc.acl.cacl"), bytes = rytest::read_file(moved + "/svc.acl.cacl");
        EXPECT_TRUE(r.rc == 0 ? bytes == new_bytes : r.rc == ACL_RC_FILE_ERROR && now == was) << r.text;  // whole
    }
}

// A cache that differs from its ACL file only in a set-user-id, set-group-id
// or sticky bit is not the file's cache: the reader compiles the text, the
// writer refuses it with 137 and leaves it alone.
TEST(CacheMode, SetIdOrStickyBitAloneMakesTheCacheAnother) {
    rytest::tmp_dir d;
    const std::string acl = d / "svc.acl", cache = acl + ".cacl";
    rytest::write_file(acl, "o r\ng staff rw\n", 0640);
    ASSERT_EQ(rytest::run_ryaclfck({"-s", "-f", acl}).status, 0);
    struct timespec past[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, acl.c_str(), past, 0), 0);  // the cache is current
    auto read_flags = [&] {
        sec_buffer_desc got{0, nullptr};
        uint32_t rflags = 0;
        EXPECT_EQ(sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_CONVERT_CACHE, &got, &rflags), 0);
        sec_release_acl(&got);
        return rflags;
    };
    ASSERT_EQ(read_flags(), SEC_ACLF_CONVERT_CACHE);  // the same mode: taken
    for (mode_t bit : {S_ISUID, S_ISGID, S_ISVTX}) {
        ASSERT_EQ(chmod(cache.c_str(), 0640 | bit), 0);
        EXPECT_EQ(read_flags(), SEC_ACLF_FROM_TEXT) << std::oct << bit;
        const std::string was = fingerprint(cache);
        EXPECT_EQ(store(acl, "\x85\x01\x02\x00\x00"), ACL_RC_FILE_ERROR) << std::oct << bit;
        EXPECT_EQ(rytest::error_msgnum(), 137) << std::oct << bit;
        EXPECT_EQ(fingerprint(cache), was) << std::oct << bit;
    }
}

// A reader passes over a cache failing under it for the text, and a store failing above: it stores nothing.
TEST_F(CacheFaults, ReaderPassesOverEveryFault) {
    ASSERT_EQ(rytest::run_ryaclfck({"-s", "-f", acl}).status, 0);
    const std::string compiled = rytest::read_file(cache);  // the text's
    struct row { const char *step; std::string path; std::function<void(const std::string &)> act; };  // path: a cache
    std::vector<row> rows{{"read:open", cache, [&](const std::string &) { unlink(cache.c_str()), mkdir(cache.c_str(), 0640); }},
                          {"read:read", cache, [&](const std::string &) { truncate(cache.c_str(), 3); }}};
    for (const fault &f : kFaults)
        if (!f.no_unlink && !f.nrs.empty() && std::strcmp(f.step, "cache:open-write") != 0)
            rows.push_back({f.step, "", [&f](const std::string &) { inject(f, f.errs[0]); }});
    for (const row &r : rows) {
        rmdir(cache.c_str()), unlink(cache.c_str());
        if (!r.path.empty()) {
            rytest::write_file(cache, compiled, 0640);
            struct timespec t[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
            ASSERT_EQ(utimensat(AT_FDCWD, acl.c_str(), t, 0), 0);  // the cache is current
        }
        outcome o = in_child(r.step, r.path, r.act, [&] {
            sec_buffer_desc got{0, nullptr};
            const uint32_t flags = SEC_ACLF_CONVERT_CACHE | SEC_ACLF_WRITE_CACHE;
            int32_t rc = sec_read_acl_file(acl.c_str(), nullptr, nullptr, flags, &got, &g_out->rflags);
            if (rc == 0 && (size_t(got.length) != compiled.size() || std::memcmp(got.value, compiled.data(), compiled.size())))
                rc = -3;  // compared by memory alone: the calls stay failing
            sec_release_acl(&got);
            return rc;
        });
        EXPECT_TRUE(o.hits >= 1 && o.rc == 0 && o.code == 0 && o.rflags == SEC_ACLF_FROM_TEXT) << r.step << " " << o.rc << o.text;
        EXPECT_EQ(rytest::list_dir(d.path()), (r.path.empty() ? strings{"svc.acl"} : strings{"svc.acl", "svc.acl.cacl"})) << r.step;
    }
}

}  // namespace
