#include "ryacl_test_support.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "ry_zo.h"
#include "ryacl_alloc.h"

extern char **environ;

namespace rytest {

namespace {
void remove_tree(const std::string &path) {
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) return;
    if (S_ISDIR(st.st_mode)) {
        chmod(path.c_str(), 0700);
        if (DIR *d = opendir(path.c_str())) {
            while (dirent *e = readdir(d)) {
                std::string n = e->d_name;
                if (n == "." || n == "..") continue;
                remove_tree(path + "/" + n);
            }
            closedir(d);
        }
        rmdir(path.c_str());
    } else {
        unlink(path.c_str());
    }
}
}  // namespace

tmp_dir::tmp_dir() {
    const char *base = std::getenv("TMPDIR");
    std::string tmpl = std::string(base && *base ? base : "/tmp") + "/ryacl-test-XXXXXX";
    std::vector<char> buf(tmpl.begin(), tmpl.end());
    buf.push_back('\0');
    if (!mkdtemp(buf.data())) throw std::runtime_error("mkdtemp failed");
    path_ = buf.data();
}

tmp_dir::~tmp_dir() { remove_tree(path_); }

void write_file(const std::string &path, const std::string &content, mode_t mode) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) throw std::runtime_error("cannot create " + path);
    size_t off = 0;
    while (off < content.size()) {
        ssize_t n = write(fd, content.data() + off, content.size() - off);
        if (n <= 0) { close(fd); throw std::runtime_error("cannot write " + path); }
        off += static_cast<size_t>(n);
    }
    fchmod(fd, mode);
    close(fd);
}

std::string read_file(const std::string &path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

bool file_exists(const std::string &path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

std::vector<std::string> list_dir(const std::string &path) {
    std::vector<std::string> names;
    if (DIR *d = opendir(path.c_str())) {
        while (dirent *e = readdir(d)) {
            std::string n = e->d_name;
            if (n != "." && n != "..") names.push_back(n);
        }
        closedir(d);
    }
    std::sort(names.begin(), names.end());
    return names;
}

run_result run(const std::vector<std::string> &argv, const std::string &cwd,
               const std::vector<std::string> &env) {
    int outp[2], errp[2];
    if (pipe2(outp, O_CLOEXEC) || pipe2(errp, O_CLOEXEC)) throw std::runtime_error("pipe");
    pid_t pid = fork();
    if (pid < 0) throw std::runtime_error("fork");
    if (pid == 0) {
        dup2(outp[1], 1);
        dup2(errp[1], 2);
        int devnull = open("/dev/null", O_RDONLY);
        if (devnull >= 0) dup2(devnull, 0);
        if (!cwd.empty() && chdir(cwd.c_str()) != 0) _exit(126);
        for (const auto &e : env) putenv(const_cast<char *>(e.c_str()));
        std::vector<char *> args;
        for (const auto &a : argv) args.push_back(const_cast<char *>(a.c_str()));
        args.push_back(nullptr);
        execv(args[0], args.data());
        _exit(127);
    }
    close(outp[1]);
    close(errp[1]);
    run_result r;
    pollfd fds[2] = {{outp[0], POLLIN, 0}, {errp[0], POLLIN, 0}};
    int open_fds = 2;
    char buf[65536];
    while (open_fds > 0) {
        if (poll(fds, 2, -1) < 0) {
            if (errno == EINTR) continue;
            break;
        }
        for (int i = 0; i < 2; ++i) {
            if (fds[i].fd < 0 || !(fds[i].revents & (POLLIN | POLLHUP | POLLERR))) continue;
            ssize_t n = read(fds[i].fd, buf, sizeof buf);
            if (n > 0) {
                (i == 0 ? r.out : r.err).append(buf, static_cast<size_t>(n));
            } else {
                close(fds[i].fd);
                fds[i].fd = -1;
                --open_fds;
            }
        }
    }
    int st = 0;
    while (waitpid(pid, &st, 0) < 0 && errno == EINTR) {
    }
    r.status = WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
    return r;
}

run_result run_ryaclfck(const std::vector<std::string> &args, const std::string &cwd,
                        const std::vector<std::string> &env) {
    std::vector<std::string> argv{RYACLFCK_PATH};
    argv.insert(argv.end(), args.begin(), args.end());
    return run(argv, cwd, env);
}

int32_t error_code() {
    zo_error_t *rec = nullptr;
    zo_get_error_1(&rec);
    int32_t rc = rec ? rec->zo_error_id : 0;
    zo_rel_error_1(rec);
    return rc;
}

int32_t error_msgnum() {
    zo_error_t *rec = nullptr;
    zo_get_error_1(&rec);
    int32_t n = rec ? rec->zo_msg_num : 0;
    zo_rel_error_1(rec);
    return n;
}

std::string error_text() {
    zo_error_t *rec = nullptr;
    zo_get_error_1(&rec);
    if (!rec) return "";
    char *text = nullptr;
    zo_get_errmsg_1(rec, &text);
    std::string s = text ? text : "";
    zo_rel_errmsg_1(text);
    zo_rel_error_1(rec);
    return s;
}

namespace {
std::atomic<long> g_count{0};
std::atomic<long> g_fail_at{0};
bool hook(size_t) {
    long n = ++g_count;
    long f = g_fail_at.load();
    return f == 0 || n != f;
}
}  // namespace

void alloc_fail_nth(long n) {
    g_count = 0;
    g_fail_at = n;
    acl__set_alloc_hook(hook);
}

void alloc_fail_none() {
    g_fail_at = 0;
    acl__set_alloc_hook(nullptr);
}

long alloc_count() { return g_count.load(); }

long for_each_alloc_failure(const std::function<int32_t()> &flow,
                            const std::function<void(int32_t rc, long nth)> &check,
                            const std::function<void()> &reset) {
    for (long nth = 1;; ++nth) {
        if (reset) reset();
        alloc_fail_nth(nth);
        int32_t rc = flow();
        long reached = alloc_count();
        alloc_fail_none();
        if (reached < nth) return nth - 1;  // the flow completed untouched
        check(rc, nth);
    }
}

}  // namespace rytest
