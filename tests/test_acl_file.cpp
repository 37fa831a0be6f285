// Reading an ACL file whole from its descriptor: NUL bytes, empty files,
// descriptors that are not regular files, files that change under the
// reader, allocation failure.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <functional>
#include <string>

#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

std::function<void()> g_on_read;  // run before each read() of the reader
struct on_read {
    explicit on_read(std::function<void()> f) {
        g_on_read = std::move(f);
        acl__set_file_step_hook([](const char *s, const char *) { if (std::string(s) == "read:read") g_on_read(); });
    }
    ~on_read() { acl__set_file_step_hook(nullptr); }
};

struct result {
    int32_t rc = 0;
    char *buf = reinterpret_cast<char *>(&rc);  // outputs must be overwritten whatever happens
    size_t size = 77;
    ~result() { std::free(buf == reinterpret_cast<char *>(&rc) ? nullptr : buf); }
};

void read_fd(int fd, result &r) { r.rc = acl__read_acl_file("acl", fd, &r.buf, &r.size); }
void read_path(const std::string &path, result &r) {
    int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK);
    read_fd(fd, r);
    if (fd >= 0) close(fd);
}
void expect_failed(const result &r, int32_t rc, int32_t msg) {
    EXPECT_EQ(r.rc, rc);
    EXPECT_EQ(rytest::error_msgnum(), msg);
    EXPECT_TRUE(r.buf == nullptr && r.size == 0);
}

TEST(AclFileRead, WholeContentsWithNulBytesAndEmptyFile) {
    rytest::tmp_dir d;
    std::string body(70000, '\0');
    for (size_t i = 0; i < body.size(); ++i) body[i] = static_cast<char>(i % 251);
    rytest::write_file(d / "acl", body);
    result r, e;
    read_path(d / "acl", r);
    ASSERT_EQ(r.rc, 0);
    ASSERT_EQ(r.size, body.size());
    EXPECT_EQ(std::string(r.buf, r.size), body);
    EXPECT_EQ(r.buf[body.size()], '\0');

    rytest::write_file(d / "empty", "");
    rytest::alloc_fail_nth(1);  // an empty file must not allocate
    read_path(d / "empty", e);
    EXPECT_EQ(rytest::alloc_count(), 0);
    rytest::alloc_fail_none();
    EXPECT_TRUE(e.rc == 0 && e.buf == nullptr && e.size == 0);
    EXPECT_EQ(acl__lock_acl_file("acl", -1, 2), 0);
}

TEST(AclFileRead, ReadsTheOpenFileUpToItsSizeNotWhatTheNameBecomes) {
    rytest::tmp_dir d;
    rytest::write_file(d / "acl", "first\n");
    int fd = open((d / "acl").c_str(), O_RDONLY), grow = open((d / "acl").c_str(), O_WRONLY | O_APPEND);
    rytest::write_file(d / "other", "a much longer replacement\n");
    ASSERT_EQ(rename((d / "other").c_str(), (d / "acl").c_str()), 0);
    on_read h([&] { (void)!write(grow, "more", 4); });
    result r;
    read_fd(fd, r);
    EXPECT_EQ(r.rc, 0);
    EXPECT_EQ(std::string(r.buf, r.size), "first\n");
    close(grow);
    close(fd);
}

TEST(AclFileRead, RefusesMissingFilesAndWhatIsNotARegularFile) {
    rytest::tmp_dir d;
    ASSERT_EQ(mkfifo((d / "fifo").c_str(), 0600), 0);
    result missing, dir, fifo;
    read_path(d / "missing", missing);  // the caller's open failed
    expect_failed(missing, 37, 122);
    EXPECT_NE(rytest::error_text().find("errno = " + std::to_string(EBADF)), std::string::npos);
    read_path(d.path(), dir);
    expect_failed(dir, 37, 122);
    read_path(d / "fifo", fifo);
    expect_failed(fifo, 37, 122);
}

TEST(AclFileRead, FileThatShrinksAfterTheSizeIsTakenIsAShortRead) {
    rytest::tmp_dir d;
    rytest::write_file(d / "acl", std::string(1000, 'a'));
    on_read h([&] { (void)!truncate((d / "acl").c_str(), 400); });
    result r;
    read_path(d / "acl", r);
    expect_failed(r, 37, 126);
    EXPECT_NE(rytest::error_text().find("only 400 bytes out of a total\nof 1000 bytes"), std::string::npos);
}

TEST(AclFileRead, AllocationFailureLeavesNothing) {
    rytest::tmp_dir d;
    rytest::write_file(d / "acl", std::string(300, 'a'));
    long sites = rytest::for_each_alloc_failure(
        [&] {
            result r;
            read_path(d / "acl", r);
            if (r.rc) { EXPECT_TRUE(r.buf == nullptr && r.size == 0); }
            return r.rc;
        },
        [&](int32_t rc, long) {
            EXPECT_EQ(rc, 6);
            EXPECT_EQ(rytest::error_msgnum(), 89);
            EXPECT_NE(rytest::error_text().find("Attempted allocation: 301 bytes"), std::string::npos);
        });
    EXPECT_EQ(sites, 1);
}

}  // namespace
