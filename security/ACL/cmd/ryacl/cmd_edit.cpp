// ryacl edit: change an ACL file the careful way.  One editor at a time
// (a lock every `ryacl edit` takes), the change made on a private copy,
// checked before it is put in place, and put in place by one rename with
// the file's owner, group and mode, so a reader only ever sees the old file
// or the new one whole.
//
// Whatever ends the run early (an editor that fails, a refused answer, a
// signal) leaves FILE as it was and removes the copy.  A signal handler does
// that removal itself, so it holds at any moment; the steps that set up what
// it removes run with the signals blocked.
#include <fcntl.h>
#include <getopt.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "acl_load.h"
#include "ry_zo_int.h"
#include "ryacl_cmd.h"
#include "ryacl_cmd_util.h"

namespace {

const char kUsage[] =
    "Usage: ryacl edit [--no-cache] FILE\n"
    "Try 'ryacl edit --help' for more information.\n";

const char kHelp[] =
    "Usage: ryacl edit [--no-cache] FILE\n"
    "Edit the ACL file FILE safely: on a private copy, checked before it\n"
    "replaces FILE.\n"
    "\n"
    "  --no-cache    do not rewrite the cache file FILE.cacl afterwards\n"
    "  -h, --help    show this help and exit\n"
    "\n"
    "The copy FILE.ryacl-XXXXXX (mode 0600, beside FILE) is opened with the\n"
    "command in $VISUAL, else $EDITOR, else vi, run by /bin/sh as\n"
    "'exec $VISUAL \"$@\"' with the copy's name as the argument, so the\n"
    "variable may hold options and quoting.  While the editor runs, ryacl\n"
    "ignores SIGINT and SIGQUIT (they are the editor's keys); SIGTERM and\n"
    "SIGHUP are passed on to the editor and end the edit.\n"
    "\n"
    "When the editor returns: an unchanged copy changes nothing.  A changed\n"
    "one is checked as by 'ryacl check'; when it has faults they are shown\n"
    "and ryacl asks\n"
    "  What now? (e)dit again, e(x)it without saving, (Q)uit and save anyway:\n"
    "reading the answer from standard input (end of input means x; quit\n"
    "takes a capital Q only).  A file to be saved replaces FILE by rename,\n"
    "with FILE's owner, group and mode (a new FILE gets mode 0644), and then\n"
    "FILE.cacl is rewritten as 'ryaclfck -s' would, unless --no-cache is\n"
    "given or the file was saved with faults.\n"
    "\n"
    "Only one 'ryacl edit' of a file runs at a time: it holds a lock on\n"
    "FILE.lock, which it creates (mode 0600) and leaves in place for the next\n"
    "edit; a second edit of the same file is told that it is busy.  A\n"
    "symbolic link is refused: edit the file it names.  An editor that\n"
    "fails, and SIGINT, SIGTERM or SIGHUP outside the editor, leave FILE as\n"
    "it was and remove the copy.\n"
    "\n"
    "Exit status: 0 when FILE was saved or left unchanged, 1 when it is busy\n"
    "or the change was dropped (x), 2 on trouble (editor failed, file not\n"
    "readable or writable, wrong usage).\n";

// What the signal handler undoes.  Set only with the handled signals
// blocked, so the handler never sees half of it.
char g_tmp[PATH_MAX + 32];
volatile sig_atomic_t g_tmp_set = 0;
volatile sig_atomic_t g_child = 0;

void on_signal(int sig) {
    if (g_child > 0) kill(static_cast<pid_t>(g_child), sig);
    if (g_tmp_set) unlink(g_tmp);
    // Die of the same signal, so the caller sees what happened.
    signal(sig, SIG_DFL);
    raise(sig);
}

constexpr int kHandled[] = {SIGINT, SIGTERM, SIGHUP};

sigset_t handled_set() {
    sigset_t s;
    sigemptyset(&s);
    for (int sig : kHandled) sigaddset(&s, sig);
    return s;
}

// The handled signals held back for a scope.
class signals_blocked {
public:
    signals_blocked() {
        sigset_t s = handled_set();
        sigprocmask(SIG_BLOCK, &s, &old_);
    }
    ~signals_blocked() { sigprocmask(SIG_SETMASK, &old_, nullptr); }
    signals_blocked(const signals_blocked &) = delete;
    signals_blocked &operator=(const signals_blocked &) = delete;
    // A handled signal arrived while held back.
    static bool pending() {
        sigset_t p;
        if (sigpending(&p) != 0) return false;
        for (int sig : kHandled)
            if (sigismember(&p, sig)) return true;
        return false;
    }
private:
    sigset_t old_;
};

void install_handlers() {
    struct sigaction sa {};
    sa.sa_handler = on_signal;
    sigemptyset(&sa.sa_mask);
    for (int sig : kHandled) sigaddset(&sa.sa_mask, sig);
    for (int sig : kHandled) sigaction(sig, &sa, nullptr);
}

std::string shown(const std::string &s) { return zo::escape_controls(s); }

int fail(const std::string &what, int err = 0) {
    std::string msg = "ryacl edit: " + what;
    if (err) msg += std::string(": ") + std::strerror(err);
    std::fprintf(stderr, "%s\n", shown(msg).c_str());
    return RYACL_EXIT_TROUBLE;
}

// Read an open file whole.
bool read_all(int fd, std::string &out) {
    out.clear();
    char buf[65536];
    for (;;) {
        ssize_t n = read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return false;
        if (n == 0) return true;
        out.append(buf, static_cast<size_t>(n));
    }
}

bool write_all(int fd, const std::string &s) {
    for (size_t at = 0; at < s.size();) {
        ssize_t n = write(fd, s.data() + at, s.size() - at);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        at += static_cast<size_t>(n);
    }
    return true;
}

// Read a regular file by name without following a link: 0 or an errno
// (EINVAL: not a regular file).
int read_regular(const std::string &path, std::string &out, struct stat *st) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY | O_NONBLOCK);
    if (fd < 0) return errno;  // ELOOP: a link
    int err = 0;
    if (fstat(fd, st) != 0) err = errno;
    else if (!S_ISREG(st->st_mode)) err = EINVAL;
    else if (!read_all(fd, out)) err = errno;
    close(fd);
    return err;
}

std::string dir_of(const std::string &path) {
    const size_t slash = path.rfind('/');
    if (slash == std::string::npos) return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

class editor_session {
public:
    editor_session(std::string file, bool cache) : file_(std::move(file)), cache_(cache) {}
    ~editor_session() {
        signals_blocked hold;
        if (g_tmp_set) unlink(g_tmp);
        g_tmp_set = 0;
        if (lock_fd_ >= 0) close(lock_fd_);
    }
    int run();

private:
    int lock();
    int make_copy();
    int edit_once();
    int commit();
    char ask();

    std::string file_;
    bool cache_;
    bool exists_ = false;
    struct stat st_ {};
    std::string original_;
    int lock_fd_ = -1;
};

int editor_session::lock() {
    const std::string name = file_ + ".lock";
    lock_fd_ = open(name.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY, 0600);
    if (lock_fd_ < 0) return fail("cannot open the lock file " + name, errno);
    struct stat ls;
    if (fstat(lock_fd_, &ls) != 0 || !S_ISREG(ls.st_mode)) return fail("the lock file " + name + " is not a regular file");
    if (flock(lock_fd_, LOCK_EX | LOCK_NB) != 0) {
        if (errno != EWOULDBLOCK) return fail("cannot lock " + name, errno);
        std::fprintf(stderr, "%s\n", shown("ryacl edit: " + file_ + " is busy: another ryacl edit is changing it").c_str());
        return RYACL_EXIT_FOUND;
    }
    return RYACL_EXIT_OK;
}

int editor_session::make_copy() {
    std::string tmpl = file_ + ".ryacl-XXXXXX";
    if (tmpl.size() >= sizeof g_tmp) return fail("file name too long: " + file_);
    int fd;
    {
        signals_blocked hold;
        std::memcpy(g_tmp, tmpl.c_str(), tmpl.size() + 1);
        // mkostemp creates exclusively, mode 0600.
        fd = mkostemp(g_tmp, O_CLOEXEC);
        if (fd >= 0) g_tmp_set = 1;
    }
    if (fd < 0) return fail("cannot create a copy beside " + file_, errno);
    const bool ok = write_all(fd, original_);
    const int err = errno;
    if (close(fd) != 0 || !ok) return fail(std::string("cannot write the copy ") + g_tmp, ok ? errno : err);
    return RYACL_EXIT_OK;
}

// Run the editor on the copy; RYACL_EXIT_OK when it exited with status 0.
int editor_session::edit_once() {
    const char *editor = std::getenv("VISUAL");
    if (!editor || !*editor) editor = std::getenv("EDITOR");
    if (!editor || !*editor) editor = "vi";
    // exec: the editor itself, not a shell above it, is the child that a
    // signal is passed on to.
    const std::string script = std::string("exec ") + editor + " \"$@\"";

    // The editor owns the terminal keys while it runs.
    struct sigaction ign {}, old_int {}, old_quit {};
    ign.sa_handler = SIG_IGN;
    sigemptyset(&ign.sa_mask);
    sigaction(SIGINT, &ign, &old_int);
    sigaction(SIGQUIT, &ign, &old_quit);
    pid_t pid;
    {
        signals_blocked hold;
        pid = fork();
        if (pid == 0) {
            struct sigaction dfl {};
            dfl.sa_handler = SIG_DFL;
            sigemptyset(&dfl.sa_mask);
            for (int sig : {SIGINT, SIGQUIT, SIGTERM, SIGHUP}) sigaction(sig, &dfl, nullptr);
            sigset_t none;
            sigemptyset(&none);
            sigprocmask(SIG_SETMASK, &none, nullptr);
            execl("/bin/sh", "sh", "-c", script.c_str(), "sh", g_tmp, static_cast<char *>(nullptr));
            _exit(127);
        }
        if (pid > 0) g_child = pid;
    }
    if (pid < 0) {
        sigaction(SIGINT, &old_int, nullptr);
        sigaction(SIGQUIT, &old_quit, nullptr);
        return fail("cannot start the editor", errno);
    }
    int status = 0;
    pid_t w;
    while ((w = waitpid(pid, &status, 0)) < 0 && errno == EINTR) {
    }
    {
        signals_blocked hold;
        g_child = 0;
    }
    sigaction(SIGINT, &old_int, nullptr);
    sigaction(SIGQUIT, &old_quit, nullptr);
    if (w < 0) return fail("cannot wait for the editor", errno);
    if (WIFSIGNALED(status))
        return fail("the editor was killed by signal " + std::to_string(WTERMSIG(status)) + "; " + file_ + " unchanged");
    if (WEXITSTATUS(status) == 127)
        return fail(std::string("the editor '") + editor + "' could not be run; " + file_ + " unchanged");
    if (WEXITSTATUS(status) != 0)
        return fail("the editor failed with exit status " + std::to_string(WEXITSTATUS(status)) + "; " + file_ +
                    " unchanged");
    return RYACL_EXIT_OK;
}

// e, x or Q; end of input is x.
char editor_session::ask() {
    for (;;) {
        std::fputs("What now? (e)dit again, e(x)it without saving, (Q)uit and save anyway: ", stdout);
        std::fflush(stdout);
        char line[256];
        if (!std::fgets(line, sizeof line, stdin)) {
            std::fputc('\n', stdout);
            return 'x';
        }
        const char c = line[0];
        if (c == 'e' || c == 'E') return 'e';
        if (c == 'x' || c == 'X') return 'x';
        if (c == 'Q') return 'Q';
    }
}

int editor_session::commit() {
    // The copy by its name: an editor may have replaced it by a new file.
    int fd = open(g_tmp, O_RDWR | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY);
    if (fd < 0) return fail(std::string("cannot open the copy ") + g_tmp, errno);
    struct stat ts;
    int err = 0;
    std::string what;
    if (fstat(fd, &ts) != 0 || !S_ISREG(ts.st_mode)) {
        err = errno;
        what = "the copy is not a regular file";
    } else if (exists_ && (ts.st_uid != st_.st_uid || ts.st_gid != st_.st_gid) &&
               fchown(fd, st_.st_uid, st_.st_gid) != 0) {
        err = errno;
        what = "cannot give the copy the owner and group of " + file_;
    } else if (fchmod(fd, exists_ ? (st_.st_mode & 07777) : 0644) != 0) {
        err = errno;
        what = "cannot give the copy the mode of " + file_;
    } else if (fsync(fd) != 0) {
        err = errno;
        what = "cannot write the copy to disk";
    }
    if (close(fd) != 0 && what.empty()) {
        err = errno;
        what = "cannot write the copy to disk";
    }
    if (!what.empty()) return fail(what + "; " + file_ + " unchanged", err);
    {
        // A signal that came before the rename still leaves FILE alone.
        signals_blocked hold;
        if (signals_blocked::pending()) return RYACL_EXIT_TROUBLE;  // delivered when the block ends
        if (rename(g_tmp, file_.c_str()) != 0) return fail("cannot replace " + file_, errno);
        g_tmp_set = 0;
    }
    // The rename itself must survive a crash too.
    int dfd = open(dir_of(file_).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dfd >= 0) {
        (void)fsync(dfd);
        close(dfd);
    }
    return RYACL_EXIT_OK;
}

int editor_session::run() {
    if (int rc = lock()) return rc;
    // Looked at under the lock: another edit may just have replaced it.
    struct stat ls;
    if (lstat(file_.c_str(), &ls) == 0) {
        if (S_ISLNK(ls.st_mode)) return fail(file_ + " is a symbolic link; edit the file it names");
        int err = read_regular(file_, original_, &st_);
        if (err == EINVAL) return fail(file_ + " is not a regular file");
        if (err) return fail("cannot read " + file_, err);
        exists_ = true;
    } else if (errno != ENOENT) {
        return fail("cannot look at " + file_, errno);
    }
    if (int rc = make_copy()) return rc;

    for (;;) {
        if (int rc = edit_once()) return rc;
        std::string now;
        struct stat ts;
        if (int err = read_regular(g_tmp, now, &ts)) return fail(std::string("cannot read the copy ") + g_tmp, err);
        if (now == original_) {
            std::fprintf(stderr, "%s\n", shown("ryacl edit: " + file_ + (exists_ ? " unchanged" : " not created")).c_str());
            return RYACL_EXIT_OK;
        }
        const int checked = ryacl_check_text(g_tmp, file_.c_str(), stderr);
        if (checked == RYACL_EXIT_OK) break;
        const char answer = ask();
        if (answer == 'e') continue;
        if (answer == 'x') {
            std::fprintf(stderr, "%s\n", shown("ryacl edit: nothing saved; " + file_ + " unchanged").c_str());
            return RYACL_EXIT_FOUND;
        }
        // Q: saved as it is; a faulty file has no compiled form to cache.
        if (int rc = commit()) return rc;
        return RYACL_EXIT_OK;
    }
    if (int rc = commit()) return rc;
    if (!cache_) return RYACL_EXIT_OK;
    // The cache writer's own temporary file is not one the handler knows:
    // a signal waits until the cache is written or refused.
    signals_blocked hold;
    return ryacl_write_cache(file_.c_str()) == RYACL_EXIT_OK ? RYACL_EXIT_OK : RYACL_EXIT_TROUBLE;
}

int run_edit(int argc, char **argv) {
    static const option longopts[] = {
        {"no-cache", no_argument, nullptr, 'n'}, {"help", no_argument, nullptr, 'h'}, {nullptr, 0, nullptr, 0}};
    bool cache = true;
    optind = 1;
    opterr = 0;
    for (int c; (c = getopt_long(argc, argv, "+h", longopts, nullptr)) != -1;) {
        if (c == 'h') {
            std::fputs(kHelp, stdout);
            return RYACL_EXIT_OK;
        }
        if (c == 'n') {
            cache = false;
            continue;
        }
        return ryacl_util::unknown_option("edit", argv[optind - 1], kUsage);
    }
    if (argc - optind != 1 || !*argv[optind]) {
        std::fputs(kUsage, stderr);
        return RYACL_EXIT_TROUBLE;
    }
    install_handlers();
    editor_session session(argv[optind], cache);
    return session.run();
}

}  // namespace

int ryacl_cmd_edit(int argc, char **argv) {
    return ryacl::out_of_memory_guard("edit", [&] { return run_edit(argc, argv); });
}
