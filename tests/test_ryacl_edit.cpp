// `ryacl edit` as a process, with scripts as the editor: unchanged, changed
// and clean, faulty and each answer, a failing editor, signals, a link, a
// busy file, a new file; and once with vi in a real terminal under tmux.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <thread>

#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;

struct RyaclEdit : ::testing::Test {
    rytest::tmp_dir dir;
    const std::string file = dir / "service.acl";
    const std::string original = "# service\no r\nu unix alice rw\n";
    void SetUp() override {
        rytest::write_file(file, original, 0640);
    }
    std::string editor(const std::string &name, const std::string &body) {
        rytest::write_file(dir / name, "#!/bin/sh\n" + body + "\n", 0755);
        return dir / name;
    }
    // ryacl edit with EDITOR=ed (VISUAL unset) and `answers` on its stdin.
    rytest::run_result edit(const std::string &ed, const std::string &answers = "", strings opts = {}) {
        std::string cmd = "printf '%s' \"$1\" | \"$0\" edit";
        for (const std::string &o : opts) cmd += " " + o;
        cmd += " \"$2\"";
        return rytest::run({"/bin/sh", "-c", cmd, RYACL_PATH, answers, file}, "",
                           {"LC_ALL=C", "NLSPATH", "VISUAL", "EDITOR=" + ed});
    }
    // Nothing but FILE, its lock and what the test put there.
    void expect_no_copy(const std::string &why) {
        for (const std::string &n : rytest::list_dir(dir.path()))
            EXPECT_EQ(n.find(".ryacl-"), std::string::npos) << why << ": " << n;
    }
    mode_t mode_of(const std::string &p) {
        struct stat st {};
        stat(p.c_str(), &st);
        return st.st_mode & 07777;
    }
};

const std::string kQuestion = "What now? (e)dit again, e(x)it without saving, (Q)uit and save anyway: ";

TEST_F(RyaclEdit, UnchangedAndCleanChanges) {
    const auto same = edit(editor("noop", "exit 0"));
    EXPECT_EQ(same.status, 0);
    EXPECT_NE(same.err.find("unchanged"), std::string::npos);
    EXPECT_EQ(rytest::read_file(file), original);
    EXPECT_FALSE(rytest::file_exists(file + ".cacl"));
    expect_no_copy("unchanged");

    // The editor sees the current text, and its change lands with FILE's mode.
    const std::string ed = editor("add", "grep -q 'alice rw' \"$1\" || exit 9\nprintf 'g ops rw\\n' >> \"$1\"");
    const auto r = edit(ed);
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(rytest::read_file(file), original + "g ops rw\n");
    EXPECT_EQ(mode_of(file), 0640u);
    EXPECT_TRUE(rytest::file_exists(file + ".cacl"));
    EXPECT_EQ(mode_of(file + ".cacl"), 0640u);
    expect_no_copy("clean");

    ::unlink((file + ".cacl").c_str());
    const auto nc = edit(editor("add2", "printf 'g dev r\\n' >> \"$1\""), "", {"--no-cache"});
    EXPECT_EQ(nc.status, 0) << nc.err;
    EXPECT_FALSE(rytest::file_exists(file + ".cacl"));
    // EDITOR may hold arguments and quoting.
    const auto args = edit("sed -i 's/alice rw/alice   r/'");
    EXPECT_EQ(args.status, 0) << args.err;
    EXPECT_NE(rytest::read_file(file).find("u unix alice   r\n"), std::string::npos);
}

TEST_F(RyaclEdit, FaultsAskWhatNowAndEachAnswerDoesWhatItSays) {
    const std::string bad = editor("bad", "printf 'x bad\\n' >> \"$1\"");
    for (const std::string quit : {"x\n", "X\n", "", "q\nx\n"}) {
        const auto r = edit(bad, quit);
        EXPECT_EQ(r.status, 1) << quit;
        EXPECT_NE(r.err.find("4471-179"), std::string::npos) << quit << r.err;  // the fault, numbered
        EXPECT_NE(r.out.find(kQuestion), std::string::npos) << quit;
        EXPECT_EQ(rytest::read_file(file), original) << quit;
        expect_no_copy(quit);
    }
    const auto twice = edit(bad, "q\nx\n");
    EXPECT_EQ(twice.out.find(kQuestion), twice.out.rfind(kQuestion) - kQuestion.size()) << twice.out;

    const auto save = edit(bad, "Q\n");
    EXPECT_EQ(save.status, 0);
    EXPECT_EQ(rytest::read_file(file), original + "x bad\n");
    EXPECT_EQ(mode_of(file), 0640u);
    EXPECT_FALSE(rytest::file_exists(file + ".cacl"));  // nothing compiled from a faulty file
    expect_no_copy("Q");

    // e: the editor runs again on the faulty copy; the second run fixes it.
    rytest::write_file(file, original, 0640);
    const std::string fixer = editor("fixer", "if [ -e \"$0.ran\" ]; then sed -i 's/^x bad$/g ops r/' \"$1\"\n"
                                              "else : > \"$0.ran\"; printf 'x bad\\n' >> \"$1\"; fi");
    const auto again = edit(fixer, "e\n");
    EXPECT_EQ(again.status, 0) << again.err;
    EXPECT_EQ(rytest::read_file(file), original + "g ops r\n");
    EXPECT_TRUE(rytest::file_exists(file + ".cacl"));
    expect_no_copy("e");
}

TEST_F(RyaclEdit, FailingEditorsLinksAndBusyFilesLeaveTheFileAlone) {
    struct probe {
        std::string what, ed;
    } probes[] = {
        {"exit 3", editor("fails", "printf 'g ops rw\\n' >> \"$1\"; exit 3")},
        {"killed", editor("killed", "printf 'g ops rw\\n' >> \"$1\"; kill -9 $$")},
        {"missing", dir / "no-such-editor"},
    };
    for (const probe &p : probes) {
        const auto r = edit(p.ed);
        EXPECT_EQ(r.status, 2) << p.what;
        EXPECT_NE(r.err.find("unchanged"), std::string::npos) << p.what << r.err;
        EXPECT_EQ(rytest::read_file(file), original) << p.what;
        expect_no_copy(p.what);
    }

    const std::string add = editor("add", "printf 'g ops rw\\n' >> \"$1\"");
    const std::string real = dir / "real.acl";
    rytest::write_file(real, original, 0640);
    ::unlink(file.c_str());
    ASSERT_EQ(::symlink(real.c_str(), file.c_str()), 0);
    const auto link = edit(add);
    EXPECT_EQ(link.status, 2);
    EXPECT_NE(link.err.find("symbolic link"), std::string::npos);
    EXPECT_EQ(rytest::read_file(real), original);
    ::unlink(file.c_str());
    rytest::write_file(file, original, 0640);

    int lock = ::open((file + ".lock").c_str(), O_RDWR | O_CREAT, 0600);
    ASSERT_GE(lock, 0);
    ASSERT_EQ(::flock(lock, LOCK_EX), 0);
    const auto busy = edit(add);
    EXPECT_EQ(busy.status, 1);
    EXPECT_NE(busy.err.find("busy"), std::string::npos);
    EXPECT_EQ(rytest::read_file(file), original);
    ::close(lock);
    expect_no_copy("busy");
    EXPECT_EQ(edit(add).status, 0);  // released: the next edit goes ahead
}

TEST_F(RyaclEdit, NewFileIsCreatedWithMode0644) {
    ::unlink(file.c_str());
    const auto none = edit(editor("noop", "exit 0"));
    EXPECT_EQ(none.status, 0);
    EXPECT_FALSE(rytest::file_exists(file));
    const auto r = edit(editor("add", "printf 'n r\\n' >> \"$1\""));
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(rytest::read_file(file), "n r\n");
    EXPECT_EQ(mode_of(file), 0644u);
}

// A run of `ryacl edit` that the test can signal while it waits.
struct running {
    pid_t pid = -1;
    int out = -1;  // its standard output
    std::string text;
    // Read its output until `what` shows (or 10 s pass).
    bool wait_for(const std::string &what) {
        const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        char buf[4096];
        fcntl(out, F_SETFL, O_NONBLOCK);
        while (text.find(what) == std::string::npos && std::chrono::steady_clock::now() < end) {
            ssize_t n = read(out, buf, sizeof buf);
            if (n > 0) text.append(buf, static_cast<size_t>(n));
            else std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
        return text.find(what) != std::string::npos;
    }
    int finish() {
        int st = 0;
        waitpid(pid, &st, 0);
        close(out);
        return WIFSIGNALED(st) ? 128 + WTERMSIG(st) : WEXITSTATUS(st);
    }
};

running start_edit(const std::string &file, const std::string &ed) {
    int outp[2], inp[2];
    running r;
    if (pipe(outp) != 0 || pipe(inp) != 0) return r;
    r.pid = fork();
    if (r.pid == 0) {
        dup2(inp[0], 0);
        dup2(outp[1], 1);
        int null = open("/dev/null", O_WRONLY);
        dup2(null, 2);
        setenv("EDITOR", ed.c_str(), 1);
        unsetenv("VISUAL");
        execl(RYACL_PATH, RYACL_PATH, "edit", file.c_str(), static_cast<char *>(nullptr));
        _exit(127);
    }
    close(outp[1]);
    close(inp[0]);
    // stdin stays open (and empty) so the prompt waits.
    r.out = outp[0];
    return r;
}

bool process_gone(pid_t pid) {
    for (int i = 0; i < 500; ++i) {
        std::string stat;
        FILE *f = std::fopen(("/proc/" + std::to_string(pid) + "/stat").c_str(), "r");
        if (!f) return true;
        char buf[512] = {0};
        size_t n = std::fread(buf, 1, sizeof buf - 1, f);
        std::fclose(f);
        stat.assign(buf, n);
        const size_t paren = stat.rfind(')');
        if (paren != std::string::npos && paren + 2 < stat.size() && stat[paren + 2] == 'Z') return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

TEST_F(RyaclEdit, SignalsLeaveTheFileAsItWasAndNoCopy) {
    // While the editor runs: SIGTERM and SIGHUP end it and the edit.
    const std::string pidfile = dir / "editor.pid";
    const std::string sleeper = editor("sleeper", "printf 'g ops rw\\n' >> \"$1\"; echo $$ > " + pidfile +
                                                  "; echo started; exec sleep 30");
    for (int sig : {SIGTERM, SIGHUP}) {
        ::unlink(pidfile.c_str());
        running r = start_edit(file, sleeper);
        ASSERT_TRUE(r.wait_for("started")) << sig;
        const pid_t ed = static_cast<pid_t>(std::atol(rytest::read_file(pidfile).c_str()));
        kill(r.pid, sig);
        EXPECT_EQ(r.finish(), 128 + sig);
        EXPECT_TRUE(process_gone(ed)) << "editor still running after signal " << sig;
        EXPECT_EQ(rytest::read_file(file), original);
        expect_no_copy("signal " + std::to_string(sig));
    }
    // At the question: SIGINT, SIGTERM and SIGHUP.
    const std::string bad = editor("bad", "printf 'x bad\\n' >> \"$1\"");
    for (int sig : {SIGINT, SIGTERM, SIGHUP}) {
        running r = start_edit(file, bad);
        ASSERT_TRUE(r.wait_for("What now?")) << sig;
        kill(r.pid, sig);
        EXPECT_EQ(r.finish(), 128 + sig);
        EXPECT_EQ(rytest::read_file(file), original);
        expect_no_copy("prompt signal " + std::to_string(sig));
    }
}

// Once through a real terminal: vi, a fault, the question answered "e", the
// fault mended, saved.
TEST_F(RyaclEdit, ViInATerminalUnderTmux) {
    if (std::system("command -v tmux >/dev/null 2>&1 && command -v vi >/dev/null 2>&1") != 0)
        GTEST_SKIP() << "tmux or vi is not installed (tools/deps --tests installs them)";
    const std::string sock = dir / "tmux.sock", status = dir / "status";
    const std::string tmux = "tmux -S '" + sock + "' ";
    const std::string cmd = "env LC_ALL=C VISUAL='vi -u NONE -N' TERM=xterm '" + std::string(RYACL_PATH) +
                            "' edit '" + file + "'; echo $? > '" + status + "'; sleep 5";
    if (std::system((tmux + "-f /dev/null new-session -d -x 120 -y 40 \"" + cmd + "\" 2>/dev/null").c_str()) != 0)
        GTEST_SKIP() << "tmux cannot start a session here";
    auto screen = [&] {
        const std::string shot = dir / "screen";
        std::system((tmux + "capture-pane -p > '" + shot + "'").c_str());
        return rytest::read_file(shot);
    };
    auto wait_screen = [&](const std::string &what) {
        for (int i = 0; i < 500; ++i) {
            if (screen().find(what) != std::string::npos) return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        return false;
    };
    auto keys = [&](const std::string &k) { std::system((tmux + "send-keys " + k).c_str()); };
    EXPECT_TRUE(wait_screen("alice rw")) << screen();
    keys("G o 'x bad' Escape ':wq' Enter");
    EXPECT_TRUE(wait_screen("What now?")) << screen();
    keys("e Enter");
    EXPECT_TRUE(wait_screen("x bad")) << screen();
    keys("G cc 'g ops rw' Escape ':wq' Enter");
    for (int i = 0; i < 500 && !rytest::file_exists(status); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(20));
    std::system((tmux + "kill-server 2>/dev/null").c_str());
    EXPECT_EQ(rytest::read_file(status), "0\n");
    EXPECT_EQ(rytest::read_file(file), original + "g ops rw\n");
    expect_no_copy("vi");
}

}  // namespace
