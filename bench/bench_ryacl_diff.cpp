// Scale of `ryacl diff`: two generated files compared as a whole process,
// against one `ryaclfck -c` check of the old file in the same run.  The
// diff is held to at most 3x that check (best of the runs, on CPU time and
// on wall time).
//
// The new file is the old one in another order with every 100th entry's
// permissions changed, every 200th removed and 1% new entries added: few
// differences, every entry matched.  "own-mech" gives every entry its own
// mechanism.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>
#include <vector>

#include "acl_gen.h"

#ifndef RYACLFCK_PATH
#error "RYACLFCK_PATH must name the built ryaclfck"
#endif
#ifndef RYACL_PATH
#error "RYACL_PATH must name the built ryacl"
#endif

namespace {

struct best {
    double wall = 1e30, cpu = 1e30;
};
std::map<std::string, best> g_best;  // "check|NAME", "diff|NAME"

std::string g_dir;

const std::string &dir() {
    if (g_dir.empty()) {
        const char *t = std::getenv("TMPDIR");
        std::string tmpl = std::string(t && *t ? t : "/tmp") + "/ryacl_bench_diff.XXXXXX";
        std::vector<char> b(tmpl.begin(), tmpl.end());
        b.push_back('\0');
        if (!mkdtemp(b.data())) std::abort();
        g_dir = b.data();
    }
    return g_dir;
}

// The two files of one configuration, written once.
void make_files(size_t n, bool own_mech, std::string *old_path, std::string *new_path) {
    const std::string tag = std::to_string(n) + (own_mech ? "-own" : "-one");
    *old_path = dir() + "/old-" + tag + ".acl";
    *new_path = dir() + "/new-" + tag + ".acl";
    if (access(new_path->c_str(), F_OK) == 0) return;
    ryacl_bench::gen_options o;
    o.entries = n;
    o.mechanisms = own_mech ? n : 1;
    o.ord = ryacl_bench::order::shuffled;
    if (!ryacl_bench::write_acl_file(*old_path, o)) std::abort();
    o.ord = ryacl_bench::order::sorted;
    const std::string text = ryacl_bench::generate_acl(o);
    std::string out;
    out.reserve(text.size() + n / 10);
    size_t k = 0;
    for (size_t at = 0, nl; (nl = text.find('\n', at)) != std::string::npos; at = nl + 1, ++k) {
        std::string line = text.substr(at, nl - at + 1);
        if (line[0] == 'u' && k % 200 == 100) continue;
        if (line[0] == 'u' && k % 100 == 0) line.insert(line.size() - 1, "c");
        out += line;
    }
    for (size_t i = 0; i < n / 100; ++i) out += "u unix newcomer" + std::to_string(i) + "@node.example.com rw\n";
    FILE *f = std::fopen(new_path->c_str(), "w");
    if (!f || std::fwrite(out.data(), 1, out.size(), f) != out.size() || std::fclose(f) != 0) std::abort();
}

double cpu_seconds(const struct rusage &ru) {
    return static_cast<double>(ru.ru_utime.tv_sec + ru.ru_stime.tv_sec) +
           static_cast<double>(ru.ru_utime.tv_usec + ru.ru_stime.tv_usec) / 1e6;
}

// Run a command with its output discarded: exit status, wall and CPU time.
int run(const std::vector<const char *> &argv, double *wall, double *cpu) {
    const auto t0 = std::chrono::steady_clock::now();
    pid_t pid = fork();
    if (pid == 0) {
        int devnull = open("/dev/null", O_WRONLY);
        dup2(devnull, 1);
        dup2(devnull, 2);
        std::vector<char *> a;
        for (const char *s : argv) a.push_back(const_cast<char *>(s));
        a.push_back(nullptr);
        execv(a[0], a.data());
        _exit(127);
    }
    int status = 0;
    struct rusage ru {};
    wait4(pid, &status, 0, &ru);
    *wall = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
    *cpu = cpu_seconds(ru);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

void bm(benchmark::State &state, size_t n, bool own_mech, bool diff) {
    std::string o, nw;
    make_files(n, own_mech, &o, &nw);
    const std::string name = std::string(diff ? "diff|" : "check|") + std::to_string(n) + (own_mech ? "/own-mech" : "/one-mech");
    best &b = g_best[name];
    for (auto _ : state) {
        double wall = 0, cpu = 0;
        const int st = diff ? run({RYACL_PATH, "diff", o.c_str(), nw.c_str()}, &wall, &cpu)
                            : run({RYACLFCK_PATH, "-c", "-f", o.c_str()}, &wall, &cpu);
        state.SetIterationTime(wall);
        // diff finds differences (1); the check of a clean file exits 0.
        if (st != (diff ? 1 : 0)) {
            state.SkipWithError(("exit status " + std::to_string(st)).c_str());
            break;
        }
        if (wall < b.wall) b.wall = wall;
        if (cpu < b.cpu) b.cpu = cpu;
    }
}

void summary() {
    std::printf("\nryacl diff against one ryaclfck -c check of the old file (best runs; target <= 3x):\n");
    bool ok = true;
    for (const auto &[name, d] : g_best) {
        if (name.rfind("diff|", 0) != 0) continue;
        const std::string cfg = name.substr(5);
        const auto c = g_best.find("check|" + cfg);
        if (c == g_best.end()) continue;
        const double rc = d.cpu / c->second.cpu, rw = d.wall / c->second.wall;
        std::printf("  %-18s cpu %.2fx  wall %.2fx\n", cfg.c_str(), rc, rw);
        ok = ok && rc <= 3.0;
    }
    std::printf("%s\n", ok ? "within target" : "OVER TARGET");
}

}  // namespace

int main(int argc, char **argv) {
    for (size_t n : {size_t{100000}, size_t{1000000}})
        for (bool own : {false, true})
            for (bool diff : {false, true}) {
                const std::string name = std::string(diff ? "diff/" : "check/") + std::to_string(n) + (own ? "/own-mech" : "/one-mech");
                benchmark::RegisterBenchmark(name.c_str(), bm, n, own, diff)->UseManualTime()->Iterations(3)->Unit(benchmark::kMillisecond);
            }
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    summary();
    if (!g_dir.empty()) std::system(("rm -rf '" + g_dir + "'").c_str());
    return 0;
}
