// A writer replacing the cache of a large ACL killed before each file operation in turn, then
// at random times while a reader in another process reads the cache as fast as it can.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <random>
#include <regex>
#include <thread>

#include "lib_acl_bytes.h"
#include "ryacl_acl_file.h"

namespace {

int32_t store(const std::string &acl, std::string bytes) {
    return sec__cache_aclbuffer(acl.c_str(), std::array{sec_acl_buffer_desc{int32_t(bytes.size()), bytes.data()}}.data(), 1);
}

long g_kill_at = 0;
void kill_at_step(const char *, const char *) { (void)(--g_kill_at == 0 && raise(SIGKILL)); }

// Reads, in shared memory: the cache old, new or SMALL (from -s), or the TEXT (a cache replaced under it).
enum { WRONG, OLD, NEW, SMALL, TEXT };
struct tally { std::atomic<int> stop; std::atomic<long> stores, seen[5]; };

TEST(CrashConsistency, WriterKilledAtEachStepAndAtRandomBesideAReader) {
    rytest::tmp_dir d;
    const std::string acl = d / "svc.acl", cache = acl + ".cacl";
    auto str = [](const libtest::bytes &b) { return std::string(b.begin(), b.end()); };
    auto big = [](unsigned seed) {  // 20,000 entries whose permissions depend on the seed
        std::vector<libtest::ent> es;
        for (unsigned i = 0; i < 20000; ++i)
            es.push_back({(seed * 2654435761u + i) & 0x1fff, "user" + std::to_string(100000 + i)});
        return libtest::make_acl({libtest::subacl(SEC_ACLE_TYPE_USER, "unix", es)});
    };
    const std::string old_acl = str(big(1)), new_acl = str(big(2)),
                      small = str(libtest::make_acl({libtest::subacl(SEC_ACLE_TYPE_ANYOTHER, "", {{1, ""}})}));  // "o r"
    rytest::write_file(acl, "o r\n", 0640);
    auto read_once = [&] {
        sec_buffer_desc got{0, nullptr};
        uint32_t rflags = 0;
        const int32_t rc = sec_read_acl_file(acl.c_str(), nullptr, nullptr, SEC_ACLF_CONVERT_CACHE, &got, &rflags);
        const std::string g = rc == 0 ? std::string(static_cast<char *>(got.value), static_cast<size_t>(got.length)) : "";
        sec_release_acl(&got);
        if (rc == 0 && rflags == SEC_ACLF_FROM_TEXT) return g == small ? TEXT : WRONG;
        if (rc || rflags != SEC_ACLF_CONVERT_CACHE) return WRONG;
        return g == old_acl ? OLD : g == new_acl ? NEW : g == small ? SMALL : WRONG;
    };
    // After a kill: the cache old or new with the file's identity, at most one temporary (-s leaves it).
    const std::regex temporary{"svc\\.acl\\.([0-9a-f]{4})+"};
    auto after_kill = [&](const std::string &what, bool next) {
        const std::string c = rytest::read_file(cache);
        struct stat a {}, s {};
        EXPECT_TRUE((c == old_acl || c == new_acl) && stat(acl.c_str(), &a) == 0 && stat(cache.c_str(), &s) == 0 &&
                    s.st_uid == a.st_uid && s.st_gid == a.st_gid && s.st_mode == a.st_mode) << what << ": " << c.size();
        const std::vector<std::string> names = rytest::list_dir(d.path());
        if (next) {
            rytest::run_result r = rytest::run_ryaclfck({"-s", "-f", acl});
            EXPECT_TRUE(r.status == 0 && rytest::list_dir(d.path()) == names && rytest::read_file(cache) == small) << r.err;
        }
        for (const std::string &n : names)
            EXPECT_TRUE(n == "svc.acl" || n == "svc.acl.cacl" ||
                        (std::regex_match(n, temporary) && lstat((d / n).c_str(), &s) == 0 && S_ISREG(s.st_mode) &&
                         s.st_size <= static_cast<off_t>(new_acl.size()) && unlink((d / n).c_str()) == 0)) << what << ": " << n;
        EXPECT_LE(names.size(), 3u) << what;
        return static_cast<int>(names.size()) - 2;
    };

    struct timespec past[2] = {{time(nullptr) - 1000, 0}, {time(nullptr) - 1000, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, acl.c_str(), past, 0), 0);  // every cache written from now on is current
    // Killed before step k, until a writer gets through.
    int step_debris = 0, random_debris = 0, status = -1, k = 0;
    std::chrono::nanoseconds span{};
    do {
        const std::string what = "killed before step " + std::to_string(++k);
        const auto t0 = std::chrono::steady_clock::now();
        ASSERT_EQ(store(acl, old_acl), 0);
        span = std::max<std::chrono::nanoseconds>(std::chrono::milliseconds(2), 3 * (std::chrono::steady_clock::now() - t0));
        const pid_t pid = fork();
        if (pid == 0) {
            g_kill_at = k;
            acl__set_file_step_hook(kill_at_step);
            _exit(store(acl, new_acl) == 0 ? 0 : 1);
        }
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(status == SIGKILL || status == 0) << what;
        EXPECT_EQ(read_once(), status ? OLD : NEW) << what;  // the old cache stands until the rename
        step_debris += after_kill(what, true);
    } while (status != 0);
    const int steps = k - 1;
    EXPECT_GE(steps, 9);       // stat, open, open-write, open-tmp, write, fchown, fchmod, fsync, close, rename
    EXPECT_GE(step_debris, 1);  // a kill between creating the temporary and the rename leaves it
    // Writers replacing the cache over and over, killed within about three replacements.
    auto *t = new (mmap(nullptr, sizeof(tally), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0)) tally{};
    const pid_t reader = fork();
    if (reader == 0) {
        alarm(120);
        while (!t->stop) ++t->seen[read_once()];
        _exit(0);
    }
    std::mt19937 rng(20261123);
    int round = 0;
    while (++round <= 41) {
        const long done = t->stores;
        const pid_t writer = fork();
        if (writer == 0)
            for (long i = 0;; ++i) store(acl, i % 2 ? old_acl : new_acl), ++t->stores;
        while (t->stores == done) usleep(100);
        std::this_thread::sleep_for(std::chrono::nanoseconds(rng() % static_cast<unsigned long>(span.count())));
        kill(writer, SIGKILL);
        ASSERT_EQ(waitpid(writer, nullptr, 0), writer);
        random_debris += after_kill("round " + std::to_string(round), round == 41);
    }
    t->stop = 1;
    ASSERT_EQ(waitpid(reader, &status, 0), reader);
    EXPECT_TRUE(status == 0 && t->seen[WRONG] == 0 && t->seen[OLD] > 0 && t->seen[NEW] > 0) << t->seen[WRONG] << " wrong reads";
    std::printf("[ crash    ] %d steps, %d kills of them left a temporary; %d random kills, %d left one; reader: %ld old, "
                "%ld new, %ld small, %ld text\n", steps, step_debris, round - 1, random_debris, +t->seen[OLD], +t->seen[NEW],
                +t->seen[SMALL], +t->seen[TEXT]);
}

}  // namespace
