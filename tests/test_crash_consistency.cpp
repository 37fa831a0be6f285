// A writer replacing the cache file of a large ACL is killed with SIGKILL
// before each of its file operations in turn, and at random times while a
// reader runs beside it.  The reader must only ever get the old or the new
// compiled ACL from the cache, whole and valid; after any kill the cache
// is the old or the new one with the ACL file's identity, the only debris
// is at most one temporary file NAME.xxxx, and the next ryaclfck -s works.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <random>
#include <regex>
#include <string>
#include <vector>

#include "ryacl.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;

// A compiled ACL of `n` user entries whose permissions depend on `seed`.
std::string big_acl(int n, uint32_t seed) {
    acl__trees_s trees;
    for (int i = 0; i < n; ++i) {
        char id[32];
        std::snprintf(id, sizeof id, "user%06d@node%d", i, i % 7);
        sec_acle_desc e{};
        e.type = SEC_ACLE_TYPE_USER;
        e.perm = (seed * 2654435761u + static_cast<uint32_t>(i)) & 0x1fff;
        std::strcpy(e.mech, i % 3 ? "unix" : "krb5");
        e.id = id;
        EXPECT_EQ(sec__add_acle_to_trees(&e, &trees), 0);
    }
    sec_acl_buffer_desc d{0, nullptr};
    EXPECT_EQ(sec__acltrees_to_acl(&trees, &d), 0);
    acl__free_trees(&trees);
    std::string s(static_cast<char *>(d.value), static_cast<size_t>(d.length));
    std::free(d.value);
    return s;
}

int32_t store(const std::string &aclfname, const std::string &bytes) {
    sec_acl_buffer_desc d{static_cast<int32_t>(bytes.size()), const_cast<char *>(bytes.data())};
    return sec__cache_aclbuffer(aclfname.c_str(), &d, 1);
}

long g_steps = 0, g_kill_at = 0;
void count_and_kill(const char *, const char *) {
    if (++g_steps == g_kill_at) raise(SIGKILL);
}

struct CrashConsistency : ::testing::Test {
    rytest::tmp_dir d;
    std::string acl = d / "svc.acl", cache = acl + ".cacl";
    const std::string text = "o r\ng staff rw\n";
    const std::string old_acl = big_acl(20000, 1), new_acl = big_acl(20000, 2);
    const std::regex temporary{"svc\\.acl\\.([0-9a-f]{4})+"};

    std::string text_acl;

    void SetUp() override {
        rytest::write_file(acl, text, 0640);
        sec_buffer_desc t{0, nullptr};
        ASSERT_EQ(sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &t, nullptr), 0);
        text_acl.assign(static_cast<char *>(t.value), static_cast<size_t>(t.length));
        sec_release_acl(&t);
        ASSERT_NE(old_acl, new_acl);
        ASSERT_GT(new_acl.size(), 300000u);
    }
    // The text file older than any cache written from now on, so readers
    // take the cache.
    void age_text() {
        struct timespec t[2] = {{time(nullptr) - 1000, 0}, {time(nullptr) - 1000, 0}};
        ASSERT_EQ(utimensat(AT_FDCWD, acl.c_str(), t, 0), 0);
    }
    // After a kill: the cache is whole, old or new, with the text file's
    // identity; at most one temporary file lies beside it.  With `next`,
    // the next ryaclfck -s works and leaves that temporary alone.  The
    // temporary is then removed so the next round starts clean.  Returns 1
    // when one was left.
    int check_after_kill(const std::string &what, bool next = false) {
        const std::string c = rytest::read_file(cache);
        EXPECT_TRUE(c == old_acl || c == new_acl) << what << ": " << c.size() << " bytes";
        struct stat a {}, s {};
        EXPECT_EQ(stat(acl.c_str(), &a) | stat(cache.c_str(), &s), 0);
        EXPECT_TRUE(s.st_uid == a.st_uid && s.st_gid == a.st_gid && s.st_mode == a.st_mode) << what;
        const strings names = rytest::list_dir(d.path());
        strings debris;
        for (const std::string &n : names) {
            if (n == "svc.acl" || n == "svc.acl.cacl") continue;
            EXPECT_TRUE(std::regex_match(n, temporary)) << what << ": " << n;
            struct stat t {};
            EXPECT_EQ(lstat((d / n).c_str(), &t), 0);
            EXPECT_TRUE(S_ISREG(t.st_mode) && t.st_size <= static_cast<off_t>(new_acl.size())) << n;
            debris.push_back(n);
        }
        EXPECT_LE(debris.size(), 1u) << what;
        if (next) {
            rytest::run_result r = rytest::run_ryaclfck({"-s", "-f", acl});
            EXPECT_EQ(r.status, 0) << what << "\n" << r.err;
            EXPECT_EQ(rytest::list_dir(d.path()), names) << what;
            EXPECT_TRUE(rytest::read_file(cache) == text_acl) << what;
        }
        for (const std::string &n : debris) unlink((d / n).c_str());
        return static_cast<int>(debris.size());
    }
    // What a reader gets: 1 the old cache, 2 the new one, 3 the text
    // compiled (a cache replaced between its look and its open is passed
    // over), 0 anything else.
    int read_once() {
        sec_buffer_desc got{0, nullptr};
        uint32_t rflags = 0;
        int32_t rc = sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_CONVERT_CACHE, &got, &rflags);
        const std::string g = rc == 0 ? std::string(static_cast<char *>(got.value), static_cast<size_t>(got.length)) : "";
        sec_release_acl(&got);
        if (rc == 0 && rflags == SEC_ACLF_CONVERT_CACHE) return g == old_acl ? 1 : g == new_acl ? 2 : 0;
        if (rc == 0 && rflags == SEC_ACLF_FROM_TEXT) return g == text_acl ? 3 : 0;
        return 0;
    }
};

TEST_F(CrashConsistency, KilledBeforeEachFileOperation) {
    ASSERT_EQ(store(acl, old_acl), 0);
    // How many file operations a whole replacement takes.
    g_kill_at = 0;
    g_steps = 0;
    acl__set_file_step_hook(count_and_kill);
    ASSERT_EQ(store(acl, new_acl), 0);
    acl__set_file_step_hook(nullptr);
    const long steps = g_steps;
    ASSERT_GE(steps, 9);  // stat, open, open-write, open-tmp, write, fchown, fchmod, fsync, close, rename

    int debris = 0;
    for (long k = 1; k <= steps + 1; ++k) {
        const std::string what = "killed before step " + std::to_string(k) + " of " + std::to_string(steps);
        ASSERT_EQ(store(acl, old_acl), 0);
        age_text();
        pid_t pid = fork();
        if (pid == 0) {
            g_steps = 0;
            g_kill_at = k;
            acl__set_file_step_hook(count_and_kill);
            _exit(store(acl, new_acl) == 0 ? 0 : 1);
        }
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        if (k <= steps) {
            EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << what;
        } else {
            EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "the writer unhindered";
        }
        // Killed before the rename the old cache stands; after it, the new.
        EXPECT_EQ(read_once(), k <= steps ? 1 : 2) << what;
        debris += check_after_kill(what, true);
    }
    // A kill between creating the temporary and renaming it leaves it.
    EXPECT_GE(debris, 1);
    std::printf("[ crash    ] %ld steps, a temporary left by %d of the kills\n", steps, debris);
}

// Writers killed at random times, replacing the cache over and over, while
// a reader in another process reads it as fast as it can.
TEST_F(CrashConsistency, KilledAtRandomTimesWithAReaderAlongside) {
    // Kills are spread over about three replacements, however long one
    // takes here (a sanitizer or valgrind slows it).
    struct timespec t0 {}, t1 {};
    clock_gettime(CLOCK_MONOTONIC, &t0);
    ASSERT_EQ(store(acl, new_acl), 0);
    ASSERT_EQ(store(acl, old_acl), 0);
    clock_gettime(CLOCK_MONOTONIC, &t1);
    const long span_ns = std::max(2000000L, 3 * ((t1.tv_sec - t0.tv_sec) * 1000000000L + t1.tv_nsec - t0.tv_nsec) / 2);
    age_text();
    struct tally {
        std::atomic<int> stop;
        std::atomic<long> reads, old_seen, new_seen, text_seen, wrong, stores;
    };
    auto *t = static_cast<tally *>(mmap(nullptr, sizeof(tally), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    ASSERT_NE(t, MAP_FAILED);
    new (t) tally{};
    pid_t reader = fork();
    if (reader == 0) {
        alarm(120);
        while (!t->stop.load()) {
            int which = read_once();
            ++t->reads;
            if (which == 1) ++t->old_seen;
            else if (which == 2) ++t->new_seen;
            else if (which == 3) ++t->text_seen;
            else ++t->wrong;
        }
        _exit(0);
    }

    std::mt19937 rng(20261123);
    int debris = 0, rounds = 40;
    // The last round runs with the reader stopped, and is followed by a
    // ryaclfck -s that must work beside whatever the kill left.
    for (int round = 0; round <= rounds; ++round) {
        const bool last = round == rounds;
        if (last) {
            t->stop = 1;
            int status = 0;
            ASSERT_EQ(waitpid(reader, &status, 0), reader);
            EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
        }
        const long done = t->stores.load();
        pid_t writer = fork();
        if (writer == 0) {
            for (long i = 0;; ++i) {
                store(acl, i % 2 ? old_acl : new_acl);
                ++t->stores;
            }
        }
        // After the first replacement of the round (a fork may start
        // slowly), then at any time.
        while (t->stores.load() == done) usleep(100);
        const long ns = static_cast<long>(rng() % static_cast<unsigned long>(span_ns));
        struct timespec nap {ns / 1000000000L, ns % 1000000000L};
        nanosleep(&nap, nullptr);
        kill(writer, SIGKILL);
        int status = 0;
        ASSERT_EQ(waitpid(writer, &status, 0), writer);
        debris += check_after_kill("round " + std::to_string(round), last);
    }
    EXPECT_EQ(t->wrong.load(), 0) << "reads that were neither the old nor the new compiled ACL, nor the text's";
    EXPECT_GT(t->old_seen.load(), 0);
    EXPECT_GT(t->new_seen.load(), 0);
    std::printf("[ crash    ] %d random kills (%d left a temporary); reader: %ld reads, %ld old, %ld new, "
                "%ld text (cache replaced under it), %ld other\n",
                rounds + 1, debris, t->reads.load(), t->old_seen.load(), t->new_seen.load(), t->text_seen.load(),
                t->wrong.load());
    munmap(t, sizeof(tally));
}

}  // namespace
