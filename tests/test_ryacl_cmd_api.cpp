// What ryacl's subcommands share with the editor, in process:
// ryacl_check_text and ryacl_write_cache.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>

#include "ryacl_cmd.h"
#include "ryacl_test_support.h"

namespace {

// Standard error goes to a file for the length of f().
template <class F>
std::string stderr_of(const rytest::tmp_dir &dir, F f) {
    std::fflush(stderr);
    const int saved = dup(2), log = open((dir / "stderr").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    dup2(log, 2);
    f();
    std::fflush(stderr);
    dup2(saved, 2), close(saved), close(log);
    return rytest::read_file(dir / "stderr");
}

TEST(RyaclCmdApi, CheckTextNamesTheDisplayedFile) {
    rytest::tmp_dir dir;
    rytest::write_file(dir / "tmp", "o r\nx\n");
    rytest::write_file(dir / "good", "o r\n");
    FILE *out = std::fopen((dir / "out").c_str(), "w+");
    ASSERT_TRUE(out);
    int faulty = -1, clean = -1, missing = -1;
    const std::string err = stderr_of(dir, [&] {
        faulty = ryacl_check_text((dir / "tmp").c_str(), "svc.acl", out);
        clean = ryacl_check_text((dir / "good").c_str(), "good.acl", out);
        missing = ryacl_check_text((dir / "none").c_str(), "none.acl", out);
    });
    std::fclose(out);
    EXPECT_EQ(faulty, RYACL_EXIT_FOUND);
    EXPECT_EQ(clean, RYACL_EXIT_OK);
    EXPECT_EQ(missing, RYACL_EXIT_TROUBLE);
    EXPECT_EQ(rytest::read_file(dir / "out").rfind("svc.acl:2: 4471-179 ", 0), 0u);
    EXPECT_EQ(err.rfind("none.acl: 4471-168 ", 0), 0u) << err;
}

TEST(RyaclCmdApi, WriteCacheStoresWhatTheCheckerStores) {
    rytest::tmp_dir dir;
    const std::string text = "o r\nu unix alice rw\ng staff r\n";
    rytest::write_file(dir / "a", text, 0600);
    rytest::write_file(dir / "b", text, 0600);
    rytest::write_file(dir / "bad", text + "x\n", 0600);
    ASSERT_EQ(rytest::run_ryaclfck({"-s", "-f", dir / "b"}).status, 0);
    int ok = -1, bad = -1;
    const std::string err = stderr_of(dir, [&] {
        ok = ryacl_write_cache((dir / "a").c_str());
        bad = ryacl_write_cache((dir / "bad").c_str());
    });
    EXPECT_EQ(ok, RYACL_EXIT_OK);
    EXPECT_EQ(rytest::read_file(dir / "a.cacl"), rytest::read_file(dir / "b.cacl"));
    struct stat st {};
    EXPECT_TRUE(stat((dir / "a.cacl").c_str(), &st) == 0 && (st.st_mode & 07777) == 0600);
    EXPECT_EQ(bad, RYACL_EXIT_TROUBLE);
    EXPECT_FALSE(rytest::file_exists(dir / "bad.cacl"));
    EXPECT_NE(err.find("4471-179 "), std::string::npos) << err;
    EXPECT_NE(err.find("4471-176 "), std::string::npos) << err;  // not cached
}

}  // namespace
