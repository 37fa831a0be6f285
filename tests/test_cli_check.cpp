// ryaclfck as a process, from golden data, and the parts of the check that
// only an in-process run reaches: a name replaced after vetting, and
// memory failures inside the check.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <climits>
#include <sstream>

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
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.status, std::stoi(rytest::read_file(c + "status")));
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
    EXPECT_EQ(fcntl(fd, F_GETFL) & O_NONBLOCK, 0);
    EXPECT_NE(fcntl(fd, F_GETFD) & FD_CLOEXEC, 0);
    close(fd);
    ASSERT_EQ(rename((d / "other").c_str(), acl.c_str()), 0);
    EXPECT_EQ(open_vetted(name, vetted, &fd), ACL_RC_BAD_FILE_NAME);
    EXPECT_EQ(rytest::error_msgnum(), 154);
    ASSERT_EQ(unlink(acl.c_str()), 0);
    ASSERT_EQ(mkfifo(acl.c_str(), 0600), 0);  // no writer: a blocking open would hang here
    EXPECT_EQ(open_vetted(name, vetted, &fd), ACL_RC_BAD_FILE_NAME);
    EXPECT_EQ(fd, -1);
}

TEST(CliCheck, MemoryFailureEndsTheCheckEvenUnderContinue) {
    rytest::tmp_dir d;
    const std::string acl = d / "acl";
    rytest::write_file(acl, "n r\nx\nu unix bob r\nu unix BOB w\ne krb5 a r\ng staff r\no w\n");
    int saved = dup(2), null = open("/dev/null", O_WRONLY);
    dup2(null, 2);
    long sites = rytest::for_each_alloc_failure(
        [&] { return aclfck__bulk_aclfile(acl.c_str(), nullptr, ACLFCK_CONTINUE); },
        [&](int32_t rc, long nth) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY) << "allocation " << nth;
            EXPECT_EQ(rytest::error_msgnum(), 89) << "allocation " << nth;
        });
    dup2(saved, 2);
    close(saved);
    close(null);
    EXPECT_GT(sites, 2);
}

}  // namespace
