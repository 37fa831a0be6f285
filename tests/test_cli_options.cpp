// Option rules beyond the golden cases (tests/golden, run by
// test_cli_check): a failing copy of an option argument, run in this
// process so the allocation hook reaches the command's code, and -u with a
// file in the current user's home directory.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>

#define main ryaclfck_process_main
#include "../security/ACL/cmd/ryaclfck/main.cpp"
#undef main
#include "../security/ACL/cmd/ryaclfck/aclfck_bulk.cpp"
#include "ryacl_test_support.h"

namespace {

// A message as the command prints it: placeholders filled, one more newline.
std::string printed(int32_t n, const std::vector<std::string> &args = {}) {
    std::string t = acl::msg_text(n);
    for (size_t i = 0; i < args.size(); ++i)
        for (const char *k : {"s", "d"}) {
            const std::string ph = "%" + std::to_string(i + 1) + "$" + k;
            for (size_t p; (p = t.find(ph)) != std::string::npos;) t.replace(p, ph.size(), args[i]);
        }
    return t + "\n";
}

// Run the command's run control in this process; its standard error is
// dropped, the error it ends with stays in the slot.
int run_here(std::vector<std::string> args) {
    args.insert(args.begin(), "ryaclfck");
    std::vector<char *> argv;
    for (std::string &a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    int saved = dup(2), null = open("/dev/null", O_WRONLY);
    dup2(null, 2);
    optind = 0;  // a fresh scan
    int status = aclfck__main(static_cast<int>(args.size()), argv.data());
    std::fflush(stderr);
    dup2(saved, 2);
    close(saved);
    close(null);
    return status;
}

TEST(CliOptions, FailedArgumentCopyReports89WithItsSizeAndExits6) {
    const std::string name = "/no/such/dir/acl";
    rytest::alloc_fail_nth(2);  // -f's copy; -t's is the first
    EXPECT_EQ(run_here({"-t", "tpl", "-f", name}), 6);  // no check, no message 148
    rytest::alloc_fail_none();
    EXPECT_EQ(rytest::error_text() + "\n", printed(89, {"main", std::to_string(name.size() + 1)}));
    rytest::alloc_fail_nth(1);  // a later -h still turns the run into exit 0
    EXPECT_EQ(run_here({"-t", "tpl", "-h", "-f", name}), 0);
    rytest::alloc_fail_none();
    EXPECT_EQ(rytest::error_text() + "\n", printed(89, {"main", "4"}));
}

TEST(CliOptions, UserFileMustBeOwnedByTheUserAndWritableByNoOneElse) {
    const passwd *pw = getpwuid(geteuid());
    struct stat hs;
    if (!pw || stat(pw->pw_dir, &hs) != 0 || !S_ISDIR(hs.st_mode) || std::string(pw->pw_dir) == "/" ||
        access(pw->pw_dir, W_OK) != 0)
        GTEST_SKIP() << "the current user's home directory is not usable";
    const std::string user = pw->pw_name, base = ".ryacl-test-" + std::to_string(getpid()) + ".acl";
    const std::string path = std::string(pw->pw_dir) + (std::string(pw->pw_dir).back() == '/' ? "" : "/") + base;
    const std::vector<std::string> env{"LC_ALL=C"};
    rytest::write_file(path, "n r\n", 0644);
    rytest::run_result r = rytest::run_ryaclfck({"-s", "-u", user, "-f", base}, "", env);
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.err, printed(150));
    EXPECT_FALSE(rytest::file_exists(path + ".cacl"));  // -u drops -s
    for (mode_t bad : {0664, 0646}) {
        chmod(path.c_str(), bad);
        r = rytest::run_ryaclfck({"-u", user, "-f", base}, "", env);
        EXPECT_EQ(r.status, 36);
        EXPECT_EQ(r.err, printed(155, {path, user}));
    }
    if (geteuid() == 0 && chmod(path.c_str(), 0644) == 0 && chown(path.c_str(), 65534, 65534) == 0) {
        r = rytest::run_ryaclfck({"-u", user, "-f", base}, "", env);
        EXPECT_EQ(r.status, 36);  // someone else's file
    }
    unlink(path.c_str());
}

}  // namespace
