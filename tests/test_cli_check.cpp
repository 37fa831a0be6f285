// ryaclfck as a process, from golden data; -u with a file in the user's
// home; and what only an in-process run reaches: a name replaced after
// vetting, memory failures in the option copies and in the check.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <climits>
#include <cstdio>
#include <sstream>

#define main ryaclfck_process_main
#include "../security/ACL/cmd/ryaclfck/main.cpp"
#undef main
#include "../security/ACL/cmd/ryaclfck/aclfck_bulk.cpp"
#include "ryacl_test_support.h"

namespace {

// Each directory under tests/golden is one run, in a fresh directory and
// the C locale:
//   args      the arguments, one per line
//   input     the ACL file "acl" (absent: none is made); mode: its octal bits
//   stderr    exact standard error; @PROG@ is the program, @DIR@ the directory
//   status    the exit status
//   cacl.hex  the bytes of acl.cacl (absent: nothing but the input remains)
const std::string kGolden = RYACL_SOURCE_DIR "/tests/golden/";

std::string subst(std::string s, const std::string &from, const std::string &to) {
    for (size_t p = 0; (p = s.find(from, p)) != std::string::npos; p += to.size()) s.replace(p, from.size(), to);
    return s;
}

class Golden : public testing::TestWithParam<std::string> {};

TEST_P(Golden, Run) {
    const std::string c = kGolden + GetParam() + "/";
    rytest::tmp_dir tmp;
    char real[PATH_MAX];
    ASSERT_NE(realpath(tmp.path().c_str(), real), nullptr);
    const std::string dir = real;
    std::vector<std::string> args, files;
    std::istringstream as(rytest::read_file(c + "args"));
    for (std::string a; std::getline(as, a);) args.push_back(a);
    if (rytest::file_exists(c + "input")) {
        mode_t mode = rytest::file_exists(c + "mode") ? std::stoi(rytest::read_file(c + "mode"), nullptr, 8) : 0644;
        rytest::write_file(dir + "/acl", rytest::read_file(c + "input"), mode);
        files.push_back("acl");
    }
    rytest::run_result r = rytest::run_ryaclfck(args, dir, {"LC_ALL=C"});
    EXPECT_EQ(r.err, subst(subst(rytest::read_file(c + "stderr"), "@PROG@", RYACLFCK_PATH), "@DIR@", dir));
    EXPECT_TRUE(r.out.empty() && r.status == std::stoi(rytest::read_file(c + "status"))) << r.status << r.out;
    if (rytest::file_exists(c + "cacl.hex")) {
        std::string bytes;
        std::istringstream hex(rytest::read_file(c + "cacl.hex"));
        for (unsigned v; hex >> std::hex >> v;) bytes += static_cast<char>(v);
        EXPECT_EQ(rytest::read_file(dir + "/acl.cacl"), bytes);
        files.push_back("acl.cacl");
    }
    EXPECT_EQ(rytest::list_dir(dir), files);  // no stray cache or temporary file
}

INSTANTIATE_TEST_SUITE_P(Cli, Golden, testing::ValuesIn(rytest::list_dir(kGolden)),
                         [](const testing::TestParamInfo<std::string> &i) {
                             std::string n = i.param;
                             for (char &ch : n) if (!std::isalnum(static_cast<unsigned char>(ch))) ch = '_';
                             return n;
                         });

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

TEST(CliCheck, UserFileMustBeOwnedByTheUserAndWritableByNoOneElse) {
    const passwd *pw = getpwuid(geteuid());
    if (!pw || access(pw->pw_dir, W_OK) != 0 || std::string(pw->pw_dir) == "/")
        GTEST_SKIP() << "the current user's home directory is not usable";
    const std::string user = pw->pw_name, base = ".ryacl-test-" + std::to_string(getpid()) + ".acl";
    const std::string path = std::string(pw->pw_dir) + (std::string(pw->pw_dir).back() == '/' ? "" : "/") + base;
    rytest::write_file(path, "n r\n", 0644);
    rytest::run_result r = rytest::run_ryaclfck({"-s", "-u", user, "-f", base}, "", {"LC_ALL=C"});
    EXPECT_TRUE(r.status == 0 && r.err == printed(150)) << r.err;
    EXPECT_FALSE(rytest::file_exists(path + ".cacl"));  // -u drops -s
    for (mode_t bad : {0664, 0646}) {
        chmod(path.c_str(), bad);
        r = rytest::run_ryaclfck({"-u", user, "-f", base}, "", {"LC_ALL=C"});
        EXPECT_TRUE(r.status == 36 && r.err == printed(155, {path, user})) << r.err;
    }
    if (geteuid() == 0 && chmod(path.c_str(), 0644) == 0 && chown(path.c_str(), 65534, 65534) == 0) {
        EXPECT_EQ(rytest::run_ryaclfck({"-u", user, "-f", base}, "", {"LC_ALL=C"}).status, 36);  // someone else's
    }
    unlink(path.c_str());
}

TEST(CliCheck, OpenRefusesANameReplacedAfterVetting) {
    rytest::tmp_dir d;
    const std::string acl = d / "acl";
    rytest::write_file(acl, "n r\n");
    rytest::write_file(d / "other", "n r\n");
    char name[ACL_FNAME_AREA];
    struct stat vetted;
    ASSERT_EQ(aclfck__get_aclfile(acl.c_str(), nullptr, name, &vetted), 0);
    int fd = -1;
    ASSERT_EQ(open_vetted(name, vetted, &fd), 0);
    EXPECT_TRUE((fcntl(fd, F_GETFL) & O_NONBLOCK) == 0 && (fcntl(fd, F_GETFD) & FD_CLOEXEC) != 0);
    close(fd);
    ASSERT_EQ(rename((d / "other").c_str(), acl.c_str()), 0);
    EXPECT_EQ(open_vetted(name, vetted, &fd), ACL_RC_BAD_FILE_NAME);
    EXPECT_EQ(rytest::error_msgnum(), 154);
    ASSERT_EQ(unlink(acl.c_str()) | mkfifo(acl.c_str(), 0600), 0);  // no writer: a blocking open would hang
    EXPECT_EQ(open_vetted(name, vetted, &fd), ACL_RC_BAD_FILE_NAME);
    EXPECT_EQ(fd, -1);
}

template <class F> auto quietly(F f) {  // standard error dropped
    int saved = dup(2), null = open("/dev/null", O_WRONLY);
    dup2(null, 2);
    auto r = f();
    std::fflush(stderr);
    dup2(saved, 2);
    close(saved);
    close(null);
    return r;
}

TEST(CliCheck, MemoryFailuresReport89AndEndTheRunEvenUnderContinue) {
    const std::string name = "/no/such/dir/acl";
    char *argv[] = {const_cast<char *>("ryaclfck"), const_cast<char *>("-t"), const_cast<char *>("tpl"),
                    const_cast<char *>("-f"), const_cast<char *>(name.c_str()), nullptr};
    optind = 0;  // a fresh scan
    rytest::alloc_fail_nth(2);  // -f's copy; -t's is the first
    EXPECT_EQ(quietly([&] { return aclfck__main(5, argv); }), 6);  // no check, no message 148
    rytest::alloc_fail_none();
    EXPECT_EQ(rytest::error_text() + "\n", printed(89, {"main", std::to_string(name.size() + 1)}));

    rytest::tmp_dir d;
    rytest::write_file(d / "acl", "n r\nx\nu unix bob r\nu unix BOB w\ne krb5 a r\ng staff r\no w\n");
    long sites = rytest::for_each_alloc_failure(
        [&] { return quietly([&] { return aclfck__bulk_aclfile((d / "acl").c_str(), nullptr, ACLFCK_CONTINUE); }); },
        [&](int32_t rc, long nth) { EXPECT_TRUE(rc == ACL_RC_NO_MEMORY && rytest::error_msgnum() == 89) << nth; });
    EXPECT_GT(sites, 2);
}

}  // namespace
