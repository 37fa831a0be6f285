// `ryacl check FILE` against `ryaclfck -c -f FILE` as whole processes on a
// generated file of 10^6 entries (shuffled, one mechanism), and on the same
// file with a fault every 1000 lines.  The two commands run in alternating
// pairs; the fastest of the runs of each counts, on CPU time (user + system
// of the child: steady on a loaded machine) and on wall time.  Next to them
// a floor: one read() of the whole file.  The target: ryacl check costs at
// most 1.1x the checker.  Exit status 1 when it misses on CPU time.
//
//   bench_ryacl_check [entries] [pairs]
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "acl_gen.h"

#if !defined(RYACLFCK_PATH) || !defined(RYACL_CMD_PATH)
#error "RYACLFCK_PATH and RYACL_CMD_PATH must name the built commands"
#endif

namespace {

struct best {
    double cpu = 1e300, wall = 1e300;
    void note(double c, double w) { cpu = std::min(cpu, c), wall = std::min(wall, w); }
};

// One process, output discarded; its CPU and wall seconds.
void run(const std::vector<const char *> &argv, best &b) {
    const auto t0 = std::chrono::steady_clock::now();
    const pid_t pid = fork();
    if (pid == 0) {
        const int null = open("/dev/null", O_WRONLY);
        dup2(null, 1), dup2(null, 2);
        execv(argv[0], const_cast<char *const *>(argv.data()));
        _exit(127);
    }
    int status = 0;
    struct rusage ru {};
    wait4(pid, &status, 0, &ru);
    const double wall = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
    const double cpu = static_cast<double>(ru.ru_utime.tv_sec + ru.ru_stime.tv_sec) +
                       static_cast<double>(ru.ru_utime.tv_usec + ru.ru_stime.tv_usec) / 1e6;
    if (!WIFEXITED(status) || WEXITSTATUS(status) > 1) {
        std::fprintf(stderr, "%s failed with status %d\n", argv[0], status);
        std::exit(2);
    }
    b.note(cpu, wall);
}

void read_floor(const std::string &path, best &b) {
    struct rusage r0 {}, r1 {};
    getrusage(RUSAGE_SELF, &r0);
    const auto t0 = std::chrono::steady_clock::now();
    const int fd = open(path.c_str(), O_RDONLY);
    struct stat st {};
    fstat(fd, &st);
    std::string buf(static_cast<size_t>(st.st_size), '\0');
    for (size_t got = 0; got < buf.size();) {
        const ssize_t n = read(fd, buf.data() + got, buf.size() - got);
        if (n <= 0) break;
        got += static_cast<size_t>(n);
    }
    close(fd);
    getrusage(RUSAGE_SELF, &r1);
    const auto sec = [](const struct rusage &r) {
        return static_cast<double>(r.ru_utime.tv_sec + r.ru_stime.tv_sec) +
               static_cast<double>(r.ru_utime.tv_usec + r.ru_stime.tv_usec) / 1e6;
    };
    b.note(sec(r1) - sec(r0), std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count());
}

}  // namespace

int main(int argc, char **argv) {
    const size_t entries = argc > 1 ? std::strtoul(argv[1], nullptr, 10) : 1000000;
    const int pairs = argc > 2 ? std::atoi(argv[2]) : 7;
    char dir[] = "/tmp/bench_ryacl_check.XXXXXX";
    if (!mkdtemp(dir)) return 2;
    const std::string clean = std::string(dir) + "/clean.acl", faulty = std::string(dir) + "/faulty.acl";
    ryacl_bench::gen_options opt;
    opt.entries = entries;
    std::string text = ryacl_bench::generate_acl(opt);
    if (!ryacl_bench::write_acl_file(clean, opt)) return 2;
    // A fault every 1000 lines: both commands report them all.
    for (size_t at = 0, line = 0; (at = text.find('\n', at)) != std::string::npos; ++at)
        if (++line % 1000 == 0) text.insert(at + 1, "x bad\n");
    FILE *f = std::fopen(faulty.c_str(), "w");
    if (!f || std::fwrite(text.data(), 1, text.size(), f) != text.size() || std::fclose(f) != 0) return 2;

    bool missed = false;
    std::printf("%-8s %10s %10s %10s %10s %8s %8s\n", "file", "floor cpu", "fck cpu", "ryacl cpu", "fck wall",
                "cpu x", "wall x");
    for (const std::string &path : {clean, faulty}) {
        best floor, fck, cmd;
        for (int i = 0; i < pairs; ++i) {
            read_floor(path, floor);
            run({RYACLFCK_PATH, "-c", "-f", path.c_str(), nullptr}, fck);
            run({RYACL_CMD_PATH, "check", path.c_str(), nullptr}, cmd);
        }
        const double cpu_x = cmd.cpu / fck.cpu, wall_x = cmd.wall / fck.wall;
        std::printf("%-8s %10.4f %10.4f %10.4f %10.4f %8.3f %8.3f\n", path == clean ? "clean" : "faulty", floor.cpu,
                    fck.cpu, cmd.cpu, fck.wall, cpu_x, wall_x);
        std::printf("         checker = %.1fx the read floor (wall)\n", fck.wall / floor.wall);
        missed |= cpu_x > 1.1;
    }
    std::printf("target: ryacl check <= 1.1x ryaclfck -c on CPU time: %s\n", missed ? "MISSED" : "met");
    unlink(clean.c_str()), unlink(faulty.c_str()), rmdir(dir);
    return missed ? 1 : 0;
}
