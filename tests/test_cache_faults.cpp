// File system faults under the cache writer and its readers, made real: at
// a chosen step (through the file step hook) a child process installs a
// seccomp filter under which the following system calls of one kind fail
// with a chosen errno, as a full disk, a quota, an I/O error or a refusing
// file system would make them fail.  Also a read-only directory, a
// directory swapped away mid-write, and a cache file that breaks while a
// reader holds it.  Every failure of the writer must give its message,
// leave an existing cache byte for byte as it was and leave no temporary
// file; every failure around a reader must be passed over for the text.
#include <gtest/gtest.h>

#include <fcntl.h>
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

#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <functional>
#include <string>
#include <vector>

#include "ry_zo.h"
#include "ryacl.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;

#if defined(__x86_64__)
constexpr uint32_t kArch = AUDIT_ARCH_X86_64;
#elif defined(__aarch64__)
constexpr uint32_t kArch = AUDIT_ARCH_AARCH64;
#else
constexpr uint32_t kArch = 0;  // no filter built for this architecture
#endif

// The system calls behind each library call, as glibc may issue them.
#define NRS(...) std::vector<long>{__VA_ARGS__}
#ifdef __NR_stat
#define STAT_NRS __NR_stat, __NR_newfstatat, __NR_statx, __NR_fstat
#define OPEN_NRS __NR_open, __NR_openat
#define RENAME_NRS __NR_rename, __NR_renameat, __NR_renameat2
#else
#define STAT_NRS __NR_newfstatat, __NR_statx, __NR_fstat
#define OPEN_NRS __NR_openat
#define RENAME_NRS __NR_renameat, __NR_renameat2
#endif

// From now on, every call of `nrs` in this process fails with `err`, or
// returns 0 having done nothing when `err` is 0.  Child processes only.
void fail_syscalls(const std::vector<long> &nrs, int err) {
    std::vector<sock_filter> f;
    f.push_back(BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch)));
    f.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArch, 1, 0));
    f.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
    f.push_back(BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)));
    for (long nr : nrs) {
        f.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, static_cast<uint32_t>(nr), 0, 1));
        f.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | (static_cast<uint32_t>(err) & SECCOMP_RET_DATA)));
    }
    f.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
    sock_fprog prog{static_cast<unsigned short>(f.size()), f.data()};
    if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 || prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &prog) != 0)
        _exit(90);
}

// What a child reports, in memory shared with the parent: written without
// a system call, so no filter can stop the report.
struct outcome {
    int32_t rc;
    int32_t code;
    int32_t msg;
    uint32_t rflags;
    int hits;  // times the chosen step was reached
    char text[4096];
};
outcome *g_out = nullptr;

std::function<void(const std::string &, const std::string &)> g_step;
void step_trampoline(const char *step, const char *path) { g_step(step, path); }

// Runs `body` in a child under a 30-second alarm; its outcome comes back.
outcome in_child(const std::function<int32_t()> &body) {
    if (!g_out)
        g_out = static_cast<outcome *>(mmap(nullptr, sizeof(outcome), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    std::memset(g_out, 0, sizeof *g_out);
    g_out->rc = -1;
    pid_t pid = fork();
    if (pid == 0) {
        alarm(30);
        acl__set_file_step_hook(step_trampoline);
        g_out->rc = body();
        g_out->code = rytest::error_code();
        g_out->msg = rytest::error_msgnum();
        std::string t = rytest::error_text();
        std::snprintf(g_out->text, sizeof g_out->text, "%s", t.c_str());
        _exit(0);
    }
    int status = 0;
    EXPECT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "child status " << status;
    return *g_out;
}

// The descriptor open on `path` left unusable for every operation, as a
// failing device or a forced unmount leaves it; the other descriptors of
// the process keep working, unlike under a filter.
void break_fd_of(const std::string &path) {
    for (int fd = 3; fd < 1024; ++fd) {
        char link[64], target[4097] = {};
        std::snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
        if (readlink(link, target, sizeof target - 1) <= 0 || path != target) continue;
        int dead = open("/dev/null", O_PATH | O_CLOEXEC);
        dup2(dead, fd);
        close(dead);
    }
}

struct file_id {
    std::string bytes;
    struct stat st;
};
file_id identity(const std::string &p) {
    file_id f{rytest::read_file(p), {}};
    EXPECT_EQ(lstat(p.c_str(), &f.st), 0) << p;
    return f;
}
void expect_same(const file_id &a, const file_id &b, const std::string &what) {
    EXPECT_TRUE(a.bytes == b.bytes) << what << ": " << a.bytes.size() << " bytes against " << b.bytes.size();
    EXPECT_TRUE(a.st.st_ino == b.st.st_ino && a.st.st_mode == b.st.st_mode && a.st.st_uid == b.st.st_uid &&
                a.st.st_mtim.tv_sec == b.st.st_mtim.tv_sec && a.st.st_mtim.tv_nsec == b.st.st_mtim.tv_nsec)
        << what;
}

struct CacheFaults : ::testing::Test {
    rytest::tmp_dir d;
    std::string acl = d / "svc.acl", cache = acl + ".cacl";
    const std::string old_bytes = std::string("\x85\x01\x02\x00\x00", 5);
    const std::string new_bytes = std::string("\x85\x01\x02\x01\x00", 5) + std::string(4000, 'n');

    void SetUp() override {
        if (!kArch) GTEST_SKIP() << "no seccomp filter for this architecture";
        rytest::write_file(acl, "o r\ng staff rw\n", 0640);
    }
    int32_t store(const std::string &name = "") {
        sec_acl_buffer_desc b{static_cast<int32_t>(new_bytes.size()), const_cast<char *>(new_bytes.data())};
        return sec__cache_aclbuffer((name.empty() ? acl : name).c_str(), &b, 1);
    }
    void make_old_cache() {
        sec_acl_buffer_desc b{static_cast<int32_t>(old_bytes.size()), const_cast<char *>(old_bytes.data())};
        ASSERT_EQ(sec__cache_aclbuffer(acl.c_str(), &b, 1), 0);
    }
};

TEST_F(CacheFaults, WriterFailingAtEachStepKeepsTheOldCacheAndNoTemporary) {
    struct fault {
        const char *step;
        std::vector<long> nrs;
        std::vector<int> errs;
        int32_t msg;
        const char *shows;  // what the message must show besides the errno
    } faults[] = {
        {"cache:stat-acl", NRS(STAT_NRS), {EACCES, EIO, ELOOP}, 122, "svc.acl)"},
        {"cache:open", NRS(OPEN_NRS), {EACCES, ENOTDIR, EIO}, 122, "svc.acl)"},
        {"cache:open-write", NRS(OPEN_NRS), {EACCES, EROFS, ETXTBSY}, 138, "svc.acl.cacl)"},
        {"cache:open-tmp", NRS(OPEN_NRS), {ENOSPC, EDQUOT, EROFS, EMFILE, EEXIST}, 138, "svc.acl."},
        {"cache:write", NRS(__NR_write), {ENOSPC, EDQUOT, EIO, EFBIG, 0}, 139, "only\n0 bytes out of a total of 4005"},
        {"cache:fchown", NRS(__NR_fchown, __NR_fchownat), {EPERM, EROFS}, 141, "to user id"},
        {"cache:fchmod", NRS(__NR_fchmod, __NR_fchmodat), {EPERM, EROFS}, 142, "to 0x1a0"},
        {"cache:fsync", NRS(__NR_fsync, __NR_fdatasync), {EIO, ENOSPC, EDQUOT}, 139, "only\n4005 bytes out of a total of 4005"},
        {"cache:close", NRS(__NR_close), {EIO, ENOSPC}, 139, "only\n4005 bytes"},
        {"cache:rename", NRS(RENAME_NRS), {EXDEV, EACCES, EBUSY, ENOSPC, EMLINK, EROFS}, 163, "Permanent CACL file"},
        // No filter: a file size limit, under which the kernel itself
        // writes part of the bytes and then refuses the rest.
        {"cache:write", {}, {EFBIG}, 139, "only\n1000 bytes out of a total of 4005"},
    };
    for (bool old : {false, true}) {
        unlink(cache.c_str());
        if (old) make_old_cache();
        for (const fault &f : faults) {
            for (int err : f.errs) {
                if (!old) unlink(cache.c_str());  // a run whose step never came stored one
                const std::string what = std::string(f.step) + " errno " + std::to_string(err) + (old ? " over a cache" : "");
                const strings before = rytest::list_dir(d.path());
                file_id was{};
                if (old) was = identity(cache);
                g_step = [&](const std::string &s, const std::string &) {
                    if (s != f.step || g_out->hits++) return;
                    if (!f.nrs.empty()) {
                        fail_syscalls(f.nrs, err);
                        return;
                    }
                    signal(SIGXFSZ, SIG_IGN);
                    struct rlimit small {};
                    getrlimit(RLIMIT_FSIZE, &small);
                    small.rlim_cur = 1000;
                    setrlimit(RLIMIT_FSIZE, &small);
                };
                outcome o = in_child([&] { return store(); });
                if (!old && std::string(f.step) == "cache:open-write") {
                    EXPECT_EQ(o.hits, 0) << "no existing cache is opened for writing";
                    continue;
                }
                ASSERT_GT(o.hits, 0) << what;
                EXPECT_EQ(o.rc, ACL_RC_FILE_ERROR) << what;
                EXPECT_EQ(o.msg, f.msg) << what << "\n" << o.text;
                EXPECT_NE(std::strstr(o.text, f.shows), nullptr) << what << "\n" << o.text;
                const std::string shown_errno = (f.msg == 122 ? "errno = " : "errno: ") + std::to_string(err);
                if (f.msg == 122 || (f.msg == 139 && (std::string(f.step) != "cache:write" || f.nrs.empty()))) {
                    EXPECT_NE(std::strstr(o.text, shown_errno.c_str()), nullptr) << what << "\n" << o.text;
                }
                EXPECT_EQ(rytest::list_dir(d.path()), before) << what;
                if (old) expect_same(identity(cache), was, what);
            }
        }
    }
}

// The directory made read-only, or swapped away for a fresh one between two
// steps: the old cache stays whole wherever its directory went, and no
// temporary file is left behind in either directory.
TEST_F(CacheFaults, ReadOnlyOrSwappedDirectory) {
    make_old_cache();
    const file_id was = identity(cache);
    if (geteuid() == 0) {  // root writes anywhere: the child acts as nobody
        ASSERT_EQ(chown(acl.c_str(), 65534, 65534) | chown(cache.c_str(), 65534, 65534), 0);
    }
    ASSERT_EQ(chmod(d.path().c_str(), 0555), 0);
    outcome o = in_child([&] {
        if (geteuid() == 0 && (setresgid(65534, 65534, 65534) || setresuid(65534, 65534, 65534))) return -2;
        return store();
    });
    ASSERT_EQ(chmod(d.path().c_str(), 0755), 0);
    ASSERT_NE(o.rc, -2) << "cannot act as nobody";
    EXPECT_EQ(o.rc, ACL_RC_FILE_ERROR);
    EXPECT_EQ(o.msg, 138) << o.text;
    EXPECT_NE(std::strstr(o.text, (acl + ".").c_str()), nullptr) << o.text;
    EXPECT_EQ(rytest::list_dir(d.path()), (strings{"svc.acl", "svc.acl.cacl"}));
    ASSERT_EQ(chown(acl.c_str(), was.st.st_uid, was.st.st_gid) | chown(cache.c_str(), was.st.st_uid, was.st.st_gid), 0);
    expect_same(identity(cache), was, "read-only directory");

    for (const char *step : {"cache:open-tmp", "cache:write", "cache:fchown", "cache:fchmod", "cache:fsync",
                             "cache:close", "cache:rename"}) {
        rytest::tmp_dir outer;
        const std::string dir = outer / "d", a = dir + "/svc.acl", c = a + ".cacl", moved = outer / "moved";
        ASSERT_EQ(mkdir(dir.c_str(), 0755), 0);
        rytest::write_file(a, "o r\n", 0640);
        {
            sec_acl_buffer_desc b{static_cast<int32_t>(old_bytes.size()), const_cast<char *>(old_bytes.data())};
            ASSERT_EQ(sec__cache_aclbuffer(a.c_str(), &b, 1), 0);
        }
        const file_id before = identity(c);
        g_step = [&](const std::string &s, const std::string &) {
            if (s != step || g_out->hits++) return;
            if (rename(dir.c_str(), moved.c_str()) != 0 || mkdir(dir.c_str(), 0755) != 0) _exit(91);
        };
        outcome r = in_child([&] { return store(a); });
        SCOPED_TRACE(step);
        ASSERT_EQ(r.hits, 1);
        // The writer stays in the directory it started in, wherever that
        // went: there the cache is the old one or the new one, whole, and
        // no temporary file is left; the directory now at the name is
        // never written.
        EXPECT_EQ(rytest::list_dir(moved), (strings{"svc.acl", "svc.acl.cacl"})) << r.text;
        EXPECT_EQ(rytest::list_dir(dir), strings{});
        if (r.rc == 0) {
            EXPECT_TRUE(rytest::read_file(moved + "/svc.acl.cacl") == new_bytes);
        } else {
            EXPECT_EQ(r.rc, ACL_RC_FILE_ERROR) << r.text;
            expect_same(identity(moved + "/svc.acl.cacl"), before, step);
        }
    }
}

// A reader whose cache file fails under it (gone for a directory, broken
// descriptor, cut short) passes over it in silence and compiles the text;
// asked to store the cache, it leaves the one there alone.
TEST_F(CacheFaults, ReaderPassesOverACacheThatFailsUnderIt) {
    const char text[] = "o r\ng staff rw\n";
    sec_buffer_desc want{0, nullptr};
    ASSERT_EQ(sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &want, nullptr), 0);
    const std::string compiled(static_cast<char *>(want.value), static_cast<size_t>(want.length));
    sec_release_acl(&want);
    ASSERT_EQ(sizeof text - 1, rytest::read_file(acl).size());

    struct fault {
        const char *step;
        std::function<void(const std::string &)> act;
    } faults[] = {
        {"read:open", [&](const std::string &) { unlink(cache.c_str()); mkdir(cache.c_str(), 0640); }},
        {"read:fstat", break_fd_of},
        {"read:read", [&](const std::string &) { truncate(cache.c_str(), 3); }},
        {"read:read", break_fd_of},
    };
    int k = 0;
    for (const fault &f : faults) {
        SCOPED_TRACE(std::string(f.step) + " #" + std::to_string(k++));
        rmdir(cache.c_str());
        unlink(cache.c_str());
        rytest::write_file(cache, compiled, 0640);
        struct timespec t[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
        ASSERT_EQ(utimensat(AT_FDCWD, acl.c_str(), t, 0), 0);  // the cache is current
        g_step = [&](const std::string &s, const std::string &p) {
            if (s != f.step || p != cache || g_out->hits++) return;
            f.act(p);
        };
        outcome o = in_child([&] {
            sec_buffer_desc got{0, nullptr};
            int32_t rc = sec_read_acl_file(acl.c_str(), nullptr, nullptr,
                                           SEC_ACLF_CONVERT_CACHE | SEC_ACLF_WRITE_CACHE, &got, &g_out->rflags);
            // The failing calls are left behind once the text was read:
            // the result is compared here, by memory alone.
            if (rc == 0 && (static_cast<size_t>(got.length) != compiled.size() ||
                            std::memcmp(got.value, compiled.data(), compiled.size()) != 0))
                rc = -3;
            sec_release_acl(&got);
            return rc;
        });
        ASSERT_GE(o.hits, 1);
        EXPECT_EQ(o.rc, 0) << o.text;
        EXPECT_EQ(o.code, 0) << o.text;
        EXPECT_EQ(o.rflags, static_cast<uint32_t>(SEC_ACLF_FROM_TEXT)) << "text compiled, nothing stored";
        EXPECT_EQ(rytest::list_dir(d.path()), (strings{"svc.acl", "svc.acl.cacl"}));
    }
}

// sec_read_acl_file asked to store the cache: a store that fails at any
// step is no failure of the read, and leaves nothing behind.
TEST_F(CacheFaults, FailedStoreNeverFailsTheRead) {
    for (const char *step : {"cache:open-tmp", "cache:write", "cache:fchmod", "cache:fsync", "cache:rename"}) {
        SCOPED_TRACE(step);
        g_step = [&](const std::string &s, const std::string &) {
            if (s != step || g_out->hits++) return;
            fail_syscalls(std::string(step) == "cache:rename" ? NRS(RENAME_NRS)
                          : std::string(step) == "cache:open-tmp" ? NRS(OPEN_NRS)
                          : std::string(step) == "cache:write" ? NRS(__NR_write)
                          : std::string(step) == "cache:fchmod" ? NRS(__NR_fchmod, __NR_fchmodat)
                                                                 : NRS(__NR_fsync, __NR_fdatasync),
                          ENOSPC);
        };
        outcome o = in_child([&] {
            sec_buffer_desc got{0, nullptr};
            int32_t rc = sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_WRITE_CACHE, &got, &g_out->rflags);
            if (rc == 0 && got.length <= 5) rc = -3;
            sec_release_acl(&got);
            return rc;
        });
        ASSERT_EQ(o.hits, 1);
        EXPECT_EQ(o.rc, 0) << o.text;
        EXPECT_EQ(o.code, 0) << o.text;
        EXPECT_EQ(o.rflags, static_cast<uint32_t>(SEC_ACLF_FROM_TEXT));
        EXPECT_EQ(rytest::list_dir(d.path()), strings{"svc.acl"});
    }
}

}  // namespace
