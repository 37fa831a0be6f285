// Scale of the checker: `ryaclfck -f FILE` and `ryaclfck -s -f FILE` as
// whole processes, and the same library path in-process (parse, add to
// trees, serialise), over generated files of 10^4, 10^5 and 10^6 entries,
// sorted, reverse-sorted and shuffled, with one mechanism or one per entry.
//
// Next to each file a floor is measured in the same run: one read() of the
// whole file into fresh pages and counting its lines with memchr, as the
// checker must at least do, in a process of its own (this program run again
// with --floor-of FILE), so that the floor pays for starting and ending a
// process as the checker does.  A second floor reads into a buffer advised
// into huge pages, as the checker's own is; ratios to it are shown beside
// the judged ones.  After the runs a summary prints, each with the
// floor it is taken against, the ratios the checker is held to:
//   check <= 4x floor (one mechanism, 10^6 entries, any order); sorted and
//   reverse no slower than shuffled; the file of 65,534 mechanisms <= 5x
//   floor; -s adds <= 25% to a check of the same file; per-entry cost at
//   10^6 <= 2x that at 10^5; peak RSS <= 5x the file size.
// Each ratio is given on wall time and on CPU time (user + system of the
// process measured): on a loaded machine only the latter is steady.  What
// a first touch of a fresh page costs on the machine is measured too: the
// floor and the checker both pay it for every page they fill, so where it
// is dear it weighs on every ratio.
//
// "own-mech" gives every entry its own mechanism.  A compiled ACL holds at
// most 65535 sub-ACLs (one of them the anyother entry's), so the runs that
// compile (-s, and the library path) use 65534 mechanisms when there are
// more entries: about 15 entries each, every one landing in a different
// small tree.  Mechanism names have one width, so the file size is the
// same either way.  What -s adds is then measured against a check of that
// same file ("check-c").
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "acl_gen.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"

#ifndef RYACLFCK_PATH
#error "RYACLFCK_PATH must name the built ryaclfck"
#endif

namespace {

using ryacl_bench::order;
using clock_type = std::chrono::steady_clock;

struct config {
    size_t n;
    order ord;
    bool own_mech;
    std::string name() const {
        return std::to_string(n) + "/" + ryacl_bench::order_name(ord) + "/" + (own_mech ? "own-mech" : "one-mech");
    }
    bool operator==(const config &o) const { return n == o.n && ord == o.ord && own_mech == o.own_mech; }
};

constexpr size_t kMaxCompiledMechs = 65534;

// One generated file at a time: 10^6-entry files are ~45 MB each.
class files {
public:
    ~files() { drop(); if (!dir_.empty()) rmdir(dir_.c_str()); }
    const std::string &get(const config &c, size_t *size, bool compiled = false) {
        const size_t mechs = !c.own_mech ? 1 : (compiled && c.n > kMaxCompiledMechs ? kMaxCompiledMechs : c.n);
        if (!(have_ && cur_ == c && mechs_ == mechs)) {
            drop();
            if (dir_.empty()) {
                const char *t = std::getenv("TMPDIR");
                std::string tmpl = std::string(t && *t ? t : "/tmp") + "/ryacl_bench.XXXXXX";
                std::vector<char> b(tmpl.begin(), tmpl.end());
                b.push_back('\0');
                if (!mkdtemp(b.data())) std::abort();
                dir_ = b.data();
            }
            path_ = dir_ + "/bench.acl";
            ryacl_bench::gen_options o;
            o.entries = c.n;
            o.ord = c.ord;
            o.mechanisms = mechs;
            o.seed = 42;
            if (!ryacl_bench::write_acl_file(path_, o)) std::abort();
            struct stat st;
            stat(path_.c_str(), &st);
            size_ = static_cast<size_t>(st.st_size);
            cur_ = c;
            mechs_ = mechs;
            have_ = true;
        }
        *size = size_;
        return path_;
    }

private:
    void drop() {
        if (!have_) return;
        unlink(path_.c_str());
        unlink((path_ + ".cacl").c_str());
        have_ = false;
    }
    std::string dir_, path_;
    config cur_{0, order::sorted, false};
    bool have_ = false;
    size_t size_ = 0, mechs_ = 0;
};

files g_files;

struct result {
    double best = 1e99;      // seconds, fastest iteration
    double best_cpu = 1e99;  // seconds of CPU, least of any iteration
    long max_rss_kb = 0;
    size_t file_size = 0;
};
std::map<std::string, result> g_results;  // "kind|config"

double seconds_since(clock_type::time_point t0) {
    return std::chrono::duration<double>(clock_type::now() - t0).count();
}

double cpu_seconds(const struct rusage &ru) {
    return static_cast<double>(ru.ru_utime.tv_sec + ru.ru_stime.tv_sec) +
           static_cast<double>(ru.ru_utime.tv_usec + ru.ru_stime.tv_usec) / 1e6;
}

double self_cpu() {
    struct rusage ru {};
    getrusage(RUSAGE_SELF, &ru);
    return cpu_seconds(ru);
}

void note(result &r, double wall, double cpu) {
    if (wall < r.best) r.best = wall;
    if (cpu < r.best_cpu) r.best_cpu = cpu;
}

// `huge`: the buffer advised into huge pages first, as the checker's own
// read buffer is.
size_t floor_once(const std::string &path, bool huge) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    struct stat st;
    fstat(fd, &st);
    size_t size = static_cast<size_t>(st.st_size);
    // Fresh pages every time, as a checker process gets: memory recycled by
    // the allocator would make the floor depend on what ran before it.
    void *map = mmap(nullptr, size + 1, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (map == MAP_FAILED) std::abort();
    char *buf = static_cast<char *>(map);
    if (huge) madvise(map, size + 1, MADV_HUGEPAGE);
    ssize_t r = read(fd, buf, size);
    close(fd);
    size_t lines = 0;
    const char *p = buf, *end = buf + (r > 0 ? r : 0);
    while ((p = static_cast<const char *>(std::memchr(p, '\n', static_cast<size_t>(end - p)))) != nullptr) {
        ++lines;
        ++p;
    }
    munmap(map, size + 1);
    return lines;
}

// The floor as a process: its CPU time, or a negative one when it failed.
double run_floor(const std::string &path, bool huge) {
    pid_t pid = fork();
    if (pid == 0) {
        int devnull = open("/dev/null", O_WRONLY);
        dup2(devnull, 1);
        execl("/proc/self/exe", "bench_check", huge ? "--huge-floor-of" : "--floor-of", path.c_str(),
              static_cast<char *>(nullptr));
        _exit(127);
    }
    int status = 0;
    struct rusage ru {};
    wait4(pid, &status, 0, &ru);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? cpu_seconds(ru) : -1;
}

void bm_floor(benchmark::State &state, config c, bool huge) {
    size_t size = 0;
    const std::string &path = g_files.get(c, &size);
    result &r = g_results[(huge ? "floor-h|" : "floor|") + c.name()];
    r.file_size = size;
    for (auto _ : state) {
        auto t0 = clock_type::now();
        const double cpu = run_floor(path, huge);
        double s = seconds_since(t0);
        state.SetIterationTime(s);
        if (cpu < 0) {
            state.SkipWithError("the floor process failed");
            break;
        }
        note(r, s, cpu);
    }
}

// Run ryaclfck as a real process; its exit status and peak RSS.
int run_checker(const std::string &path, bool cache, long *max_rss_kb, double *cpu) {
    pid_t pid = fork();
    if (pid == 0) {
        int devnull = open("/dev/null", O_WRONLY);
        dup2(devnull, 1);
        dup2(devnull, 2);
        if (cache) execl(RYACLFCK_PATH, "ryaclfck", "-s", "-f", path.c_str(), static_cast<char *>(nullptr));
        else execl(RYACLFCK_PATH, "ryaclfck", "-f", path.c_str(), static_cast<char *>(nullptr));
        _exit(127);
    }
    int status = 0;
    struct rusage ru {};
    wait4(pid, &status, 0, &ru);
    *max_rss_kb = ru.ru_maxrss;
    *cpu = cpu_seconds(ru);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// kind "check-c": a check without -s of the file -s compiles, where that
// file has fewer mechanisms than the plain check's.
void bm_check(benchmark::State &state, config c, bool cache, bool compiled_file = false) {
    size_t size = 0;
    const std::string &path = g_files.get(c, &size, cache || compiled_file);
    result &r = g_results[std::string(cache ? "check-s|" : compiled_file ? "check-c|" : "check|") + c.name()];
    r.file_size = size;
    for (auto _ : state) {
        long rss = 0;
        double cpu = 0;
        auto t0 = clock_type::now();
        int st = run_checker(path, cache, &rss, &cpu);
        double s = seconds_since(t0);
        state.SetIterationTime(s);
        if (st != 0) {
            state.SkipWithError(("ryaclfck exited with " + std::to_string(st)).c_str());
            break;
        }
        note(r, s, cpu);
        if (rss > r.max_rss_kb) r.max_rss_kb = rss;
    }
    state.counters["rss_x_file"] = static_cast<double>(r.max_rss_kb) * 1024.0 / static_cast<double>(size);
}

// The library road the checker and sec_read_acl_file take, in-process:
// read, parse a batch ahead into trees that keep identifiers in the text,
// serialise, release.
void bm_library(benchmark::State &state, config c) {
    size_t size = 0;
    const std::string &path = g_files.get(c, &size, true);
    result &r = g_results["lib|" + c.name()];
    r.file_size = size;
    struct quiet_sink final : acl__text_sink {
        void fault(int32_t, int32_t) override {}
    } sink;
    acl__textfile_opts o{ACL_RC_FILE_ERROR, 0, 0, 0};
    o.trees_borrow_text = true;
    for (auto _ : state) {
        double c0 = self_cpu();
        auto t0 = clock_type::now();
        int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
        char *buf = static_cast<char *>(std::malloc(size + 1));
        if (read(fd, buf, size) != static_cast<ssize_t>(size)) std::abort();
        close(fd);
        buf[size] = '\0';
        acl__trees_s trees;
        acl__parse_result res;
        int32_t rc = acl__parse_acltext(buf, size, o, sink, &trees, &res);
        sec_buffer_desc acl{0, nullptr};
        if (rc == 0) rc = sec__acltrees_to_acl(&trees, &acl);
        std::free(acl.value);
        acl__free_trees(&trees);
        std::free(buf);
        double s = seconds_since(t0);
        state.SetIterationTime(s);
        if (rc != 0) {
            state.SkipWithError(("library path failed with " + std::to_string(rc)).c_str());
            break;
        }
        note(r, s, self_cpu() - c0);
    }
}

const size_t kSizes[] = {10000, 100000, 1000000};
const order kOrders[] = {order::sorted, order::reverse, order::shuffled};

void register_all() {
    for (size_t n : kSizes)
        for (bool own : {false, true})
            for (order o : kOrders) {
                config c{n, o, own};
                int iters = n >= 1000000 ? 7 : (n >= 100000 ? 8 : 30);
                auto reg = [&](const std::string &kind, auto fn) {
                    benchmark::RegisterBenchmark((kind + "/" + c.name()).c_str(), fn)
                        ->UseManualTime()
                        ->Unit(benchmark::kMillisecond)
                        ->Iterations(iters);
                };
                reg("floor", [c](benchmark::State &s) { bm_floor(s, c, false); });
                reg("floor-h", [c](benchmark::State &s) { bm_floor(s, c, true); });
                reg("check", [c](benchmark::State &s) { bm_check(s, c, false); });
                reg("check-s", [c](benchmark::State &s) { bm_check(s, c, true); });
                if (own && n > kMaxCompiledMechs)
                    reg("check-c", [c](benchmark::State &s) { bm_check(s, c, false, true); });
                reg("lib", [c](benchmark::State &s) { bm_library(s, c); });
            }
}

const result *find(const std::string &kind, const config &c) {
    auto it = g_results.find(kind + "|" + c.name());
    return it == g_results.end() || it->second.best >= 1e98 ? nullptr : &it->second;
}

// A limit of 0 shows the ratio without judging it: the targets are set for
// 10^6 entries, where a process start and a few fixed allocations no longer
// weigh against a file read in well under a millisecond.
void line(const char *what, const std::string &where, double wall, double cpu, double limit,
          const std::string &against = "") {
    if (limit <= 0) {
        std::printf("  %-36s %-26s %7.2f      %7.2f        %s\n", what, where.c_str(), wall, cpu, against.c_str());
        return;
    }
    std::printf("  %-36s %-26s %7.2f %s %7.2f %s  (limit %.2f) %s\n", what, where.c_str(), wall,
                wall <= limit ? "ok  " : "OVER", cpu, cpu <= limit ? "ok  " : "OVER", limit, against.c_str());
}

std::string ms(const result *r) {
    char b[64];
    std::snprintf(b, sizeof b, "%.1f / %.1f ms", r->best * 1e3, r->best_cpu * 1e3);
    return b;
}

// Ratio of two results, on wall and on CPU time, each scaled by `k`; the
// time it is taken against (b's wall / CPU) shown beside it.
void ratio(const char *what, const std::string &where, const result *a, const result *b, double limit,
           double k = 1.0) {
    if (a && b) line(what, where, k * a->best / b->best, k * a->best_cpu / b->best_cpu, limit, "vs " + ms(b));
}

// What the first touch of a fresh 4 KiB page costs: the fastest of a few
// rounds over 64 MiB of fresh anonymous memory.
double page_fault_ns() {
    constexpr size_t kPages = 16384, kPage = 4096;
    double best = 1e99;
    for (int round = 0; round < 5; ++round) {
        void *m = mmap(nullptr, kPages * kPage, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (m == MAP_FAILED) return 0;
        volatile char *p = static_cast<char *>(m);
        auto t0 = clock_type::now();
        for (size_t i = 0; i < kPages; ++i) p[i * kPage] = 1;
        const double s = seconds_since(t0);
        munmap(m, kPages * kPage);
        if (s < best) best = s;
    }
    return best * 1e9 / kPages;
}

// The targets of the checker, first, each with its floor.
void targets() {
    const size_t n = 1000000;
    std::printf("\nChecker targets (10^6 entries; floor: read into fresh pages and count lines, wall / CPU)\n");
    const double pf = page_fault_ns();
    std::printf("  first touch of a fresh 4 KiB page: %.0f ns (%.2f ms per MiB)\n", pf, pf * 256 / 1e6);
    std::printf("  %-36s %-26s %12s %12s\n", "ratio", "file", "wall", "cpu");
    for (order o : kOrders) {
        config c{n, o, false};
        ratio("check / floor", c.name(), find("check", c), find("floor", c), 4.0);
    }
    const result *sh = find("check", config{n, order::shuffled, false});
    for (order o : {order::sorted, order::reverse})
        ratio((std::string("check ") + ryacl_bench::order_name(o) + " / shuffled").c_str(),
              config{n, o, false}.name(), find("check", config{n, o, false}), sh, 1.0);
    const config many{n, order::shuffled, true};
    ratio("check / floor, 65,534 mechanisms", many.name(), find("check-c", many), find("floor", many), 5.0);
    for (order o : kOrders) {
        config c{n, o, false};
        ratio("check -s / check", c.name(), find("check-s", c), find("check", c), 1.25);
    }
    ratio("check -s / check, 65,534 mechanisms", many.name(), find("check-s", many), find("check-c", many), 1.25);
    // The checker advises its own read buffer into huge pages, which the
    // floor above does not: against a floor that does the same, what is
    // left is the checker's own work.  Shown, not judged.
    std::printf("  against a floor whose buffer is advised into huge pages, as the checker's is:\n");
    for (order o : kOrders) {
        config c{n, o, false};
        ratio("check / huge-page floor", c.name(), find("check", c), find("floor-h", c), 0.0);
    }
    ratio("check / huge-page floor, 65,534 mech.", many.name(), find("check-c", many), find("floor-h", many), 0.0);
}

void summary() {
    targets();
    std::printf("\nSummary (fastest iteration of each)\n");
    std::printf("  %-36s %-26s %12s %12s\n", "ratio", "file", "wall", "cpu");
    for (size_t n : kSizes)
        for (bool own : {false, true})
            for (order o : kOrders) {
                config c{n, o, own};
                const double judged = n >= 1000000 ? 1.0 : 0.0;
                const result *fl = find("floor", c);
                for (const char *kind : {"check", "check-s", "lib"})
                    ratio((std::string(kind) + " / floor").c_str(), c.name(), find(kind, c), fl,
                          (own || std::strcmp(kind, "check") != 0 ? 5.0 : 4.0) * judged);
                for (const char *kind : {"check", "check-s"})
                    if (const result *ck = find(kind, c)) {
                        double x = static_cast<double>(ck->max_rss_kb) * 1024.0 / static_cast<double>(ck->file_size);
                        line((std::string(kind) + " peak RSS / file size").c_str(), c.name(), x, x, 5.0 * judged);
                    }
                // Against a check of the very file -s compiled (see "files").
                const result *same = find("check-c", c);
                ratio("check -s / check", c.name(), find("check-s", c), same ? same : find("check", c),
                      1.25 * judged);
            }
    for (const char *kind : {"check", "check-s", "lib"})
        for (size_t n : kSizes)
            for (bool own : {false, true}) {
                const result *sh = find(kind, config{n, order::shuffled, own});
                for (order o : {order::sorted, order::reverse}) {
                    config c{n, o, own};
                    ratio((std::string(kind) + " " + ryacl_bench::order_name(o) + " / shuffled").c_str(), c.name(),
                          find(kind, c), sh, 1.0);
                }
                if (own)
                    for (order o : kOrders)
                        ratio((std::string(kind) + " own-mech / one-mech").c_str(), config{n, o, true}.name(),
                              find(kind, config{n, o, true}), find(kind, config{n, o, false}), 2.0);
            }
    for (const char *kind : {"check", "check-s", "lib"})
        for (bool own : {false, true})
            for (order o : kOrders)
                ratio((std::string(kind) + " per entry 10^6 / 10^5").c_str(), config{1000000, o, own}.name(),
                      find(kind, config{1000000, o, own}), find(kind, config{100000, o, own}), 2.0, 0.1);
}

}  // namespace

int main(int argc, char **argv) {
    if (argc == 3 && (std::strcmp(argv[1], "--floor-of") == 0 || std::strcmp(argv[1], "--huge-floor-of") == 0)) {
        std::printf("%zu\n", floor_once(argv[2], std::strcmp(argv[1], "--huge-floor-of") == 0));
        return 0;
    }
    register_all();
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    summary();
    return 0;
}
