// ryaclfck as a process on real files, from golden data; -u with a file in
// the user's home; and in process, memory failures.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <regex>
#include <sstream>

#include "aclfck.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

// Each directory under tests/golden is one run in a fresh directory and the C locale: args (one a
// line); input, the file "acl" (absent: none), with its octal mode; stderr, exact but for @PROG@ and
// @DIR@; status; cacl.hex, the bytes of acl.cacl (absent: nothing but the input may remain).
using strings = std::vector<std::string>;
const std::string kGolden = RYACL_SOURCE_DIR "/tests/golden/";
const size_t npos = std::string::npos;

class Golden : public testing::TestWithParam<std::string> {};

TEST_P(Golden, Run) {
    auto has = [&](const char *f) { return rytest::file_exists(kGolden + GetParam() + "/" + f); };
    auto get = [&](const char *f) { return rytest::read_file(kGolden + GetParam() + "/" + f); };
    rytest::tmp_dir tmp;
    const std::string dir = std::filesystem::canonical(tmp.path());  // as the checker prints it
    std::vector<std::string> args, files;
    std::istringstream as(get("args"));
    for (std::string a; std::getline(as, a);) args.push_back(a);
    if (has("input")) {
        rytest::write_file(dir + "/acl", get("input"), has("mode") ? std::stoi(get("mode"), nullptr, 8) : 0644);
        files.push_back("acl");
    }
    rytest::run_result r = rytest::run_ryaclfck(args, dir, {"LC_ALL=C"});
    EXPECT_EQ(r.err, std::regex_replace(std::regex_replace(get("stderr"), std::regex("@PROG@"), RYACLFCK_PATH),
                                        std::regex("@DIR@"), dir));
    EXPECT_TRUE(r.out.empty() && r.status == std::stoi(get("status"))) << r.status << r.out;
    if (has("cacl.hex")) {
        std::string bytes;
        std::istringstream hex(get("cacl.hex"));
        for (unsigned v; hex >> std::hex >> v;) bytes += static_cast<char>(v);
        EXPECT_EQ(rytest::read_file(dir + "/acl.cacl"), bytes);
        files.push_back("acl.cacl");
    }
    EXPECT_EQ(rytest::list_dir(dir), files);  // no stray cache or temporary file
}

INSTANTIATE_TEST_SUITE_P(Cli, Golden, testing::ValuesIn(rytest::list_dir(kGolden)));

TEST(CliCheck, UserFileMustBeOwnedByTheUserAndWritableByNoOneElse) {
    const passwd *pw = getpwuid(geteuid());
    if (!pw || access(pw->pw_dir, W_OK) != 0 || std::string(pw->pw_dir) == "/")
        GTEST_SKIP() << "the current user's home directory is not usable";
    const std::string user = pw->pw_name, base = ".ryacl-test-" + std::to_string(getpid());
    const std::string path = std::filesystem::path(pw->pw_dir) / base;
    rytest::write_file(path, "n r\n", 0644);
    auto r = rytest::run_ryaclfck({"-s", "-u", user, "-f", base}, "", {"LC_ALL=C"});
    EXPECT_TRUE(r.status == 0 && r.err == acl::msg_text(150) + std::string("\n")) << r.err;
    EXPECT_FALSE(rytest::file_exists(path + ".cacl"));  // -u drops -s
    for (mode_t bad : {0664, 0646}) {
        chmod(path.c_str(), bad);
        r = rytest::run_ryaclfck({"-u", user, "-f", base}, "", {"LC_ALL=C"});
        EXPECT_TRUE(r.status == 36 && r.err.rfind("4471-169 ", 0) == 0 && r.err.find("(" + path + ")") != npos &&
                    r.err.find("(" + user + ")") != npos) << r.err;
    }
    EXPECT_TRUE(geteuid() != 0 || chmod(path.c_str(), 0644) != 0 || chown(path.c_str(), 65534, 65534) != 0 ||
                rytest::run_ryaclfck({"-u", user, "-f", base}, "", {"LC_ALL=C"}).status == 36);  // someone else's
    unlink(path.c_str());
}

// A file that is there but cannot be opened (no read permission) is the
// open's failure, with its errno: 156 for the checker, 124 for the library.
TEST(CliCheck, AFileThatCannotBeOpenedReportsTheOpensErrno) {
    rytest::tmp_dir d;
    ASSERT_EQ(chmod(d.path().c_str(), 0755), 0);
    rytest::write_file(d / "acl", "n r\n", 0);
    // Root reads anything: run as nobody.
    const strings as = geteuid() == 0 ? strings{"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"}
                                      : strings{};
    auto run = [&](strings args) {
        args.insert(args.begin(), as.begin(), as.end());
        return rytest::run(args, "", {"LC_ALL=C"});
    };
    const auto fck = run({RYACLFCK_PATH, "-f", d / "acl"}), lib = run({RYACL_CMD_PATH, "query", "-n", d / "acl"});
    const std::string errno_line = "returned by the open() subroutine: " + std::to_string(EACCES) + ".";
    EXPECT_EQ(fck.status, ACL_RC_FILE_ERROR);
    EXPECT_TRUE(fck.err.rfind("4471-170 ", 0) == 0 && fck.err.find(errno_line) != npos) << fck.err;
    EXPECT_EQ(lib.status, 2);
    EXPECT_TRUE(lib.err.rfind("4471-137 ", 0) == 0 && lib.err.find(errno_line) != npos) << lib.err;
}

// In process: a memory failure is never a fault of the file, so it ends
// the run with 6 and message 89 even under -c, from the option copies on.
TEST(CliCheck, MemoryFailuresReport89AndEndTheRunEvenUnderContinue) {
    auto quietly = [](auto f) {  // standard error dropped
        int saved = dup(2), null = open("/dev/null", O_WRONLY);
        dup2(null, 2);
        auto r = f();
        std::fflush(stderr);
        dup2(saved, 2), close(saved), close(null);
        return r;
    };
    char *argv[] = {const_cast<char *>("ryaclfck"), const_cast<char *>("-t"), const_cast<char *>("tpl"),
                    const_cast<char *>("-f"), const_cast<char *>("/no/such/dir/acl"), nullptr};
    optind = 0;                 // a fresh scan
    rytest::alloc_fail_nth(2);  // -f's copy; -t's is the first
    EXPECT_EQ(quietly([&] { return aclfck__main(5, argv); }), 6);  // no check, no message 148
    rytest::alloc_fail_none();
    EXPECT_EQ(rytest::error_msgnum(), 89);
    rytest::tmp_dir d;
    rytest::write_file(d / "acl", "n r\nx\nu unix bob r\nu unix BOB w\ne krb5 a r\ng staff r\no w\n");
    long sites = rytest::for_each_alloc_failure(
        [&] { return quietly([&] { return aclfck__bulk_aclfile((d / "acl").c_str(), nullptr, ACLFCK_CONTINUE); }); },
        [&](int32_t rc, long nth) { EXPECT_TRUE(rc == ACL_RC_NO_MEMORY && rytest::error_msgnum() == 89) << nth; });
    EXPECT_GT(sites, 2);
}

}  // namespace
