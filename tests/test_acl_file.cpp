// Reading an ACL file whole from its descriptor: NUL bytes, empty files,
// files that change under the reader, every failure leaving no buffer.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>

#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

std::function<void()> g_on_read;  // run before each read() of the reader

struct result {
    int32_t rc;
    bool cleared;      // no buffer and size 0
    std::string text;  // what was read, with the terminator
};
result read_fd(int fd, std::function<void()> on_read = {}) {
    g_on_read = std::move(on_read);
    acl__set_file_step_hook([](const char *s, const char *) { if (g_on_read && !std::strcmp(s, "read:read")) g_on_read(); });
    char junk, *buf = &junk;  // outputs must be overwritten whatever happens
    size_t size = 77;
    result r{acl__read_acl_file("acl", fd, &buf, &size), false, ""};
    acl__set_file_step_hook(nullptr);
    r.cleared = buf == nullptr && size == 0;
    if (buf && buf != &junk) r.text.assign(buf, size + 1);
    if (buf != &junk) std::free(buf);
    return r;
}
result read_path(const std::string &path, std::function<void()> on_read = {}) {
    int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK);
    result r = read_fd(fd, std::move(on_read));
    if (fd >= 0) close(fd);
    return r;
}

TEST(AclFileRead, WholeContentsWithNulBytesAndEmptyFileWithoutAllocating) {
    rytest::tmp_dir d;
    std::string body(70000, '\0');
    for (size_t i = 0; i < body.size(); ++i) body[i] = static_cast<char>(i % 251);
    rytest::write_file(d / "acl", body);
    result r = read_path(d / "acl");
    EXPECT_TRUE(r.rc == 0 && r.text == body + '\0');
    rytest::write_file(d / "empty", "");
    rytest::alloc_fail_nth(1);
    r = read_path(d / "empty");
    EXPECT_EQ(rytest::alloc_count(), 0);
    rytest::alloc_fail_none();
    EXPECT_TRUE(r.rc == 0 && r.cleared);
}

TEST(AclFileRead, ReadsTheOpenFileUpToItsSizeNotWhatTheNameBecomes) {
    rytest::tmp_dir d;
    rytest::write_file(d / "acl", "first\n");
    int fd = open((d / "acl").c_str(), O_RDONLY), grow = open((d / "acl").c_str(), O_WRONLY | O_APPEND);
    rytest::write_file(d / "other", "a much longer replacement\n");
    ASSERT_EQ(rename((d / "other").c_str(), (d / "acl").c_str()), 0);
    result r = read_fd(fd, [&] { (void)!write(grow, "more", 4); });
    EXPECT_TRUE(r.rc == 0 && r.text == std::string("first\n", 7)) << r.text;
    close(grow);
    close(fd);
}

TEST(AclFileRead, FailuresGiveTheirMessageAndNoBuffer) {
    rytest::tmp_dir d;
    ASSERT_EQ(mkfifo((d / "fifo").c_str(), 0600), 0);
    rytest::write_file(d / "acl", std::string(1000, 'a'));
    const struct { std::string path; int32_t msg; std::string shows; } cases[] = {
        {d / "missing", 122, "errno = " + std::to_string(EBADF)},  // the caller's open failed
        {d.path(), 122, ""},
        {d / "fifo", 122, ""},
        {d / "acl", 126, "only 400 bytes out of a total\nof 1000 bytes"},  // shrinks after the size is taken
    };
    for (const auto &c : cases) {
        result r = read_path(c.path, [&] { (void)!truncate(c.path.c_str(), 400); });
        EXPECT_TRUE(r.rc == 37 && r.cleared) << c.path;
        EXPECT_EQ(rytest::error_msgnum(), c.msg) << c.path;
        EXPECT_NE(rytest::error_text().find(c.shows), std::string::npos) << rytest::error_text();
    }
    rytest::write_file(d / "acl", std::string(300, 'a'));
    rytest::alloc_fail_nth(1);  // the one allocation: size and terminator
    result r = read_path(d / "acl");
    EXPECT_EQ(rytest::alloc_count(), 1);
    rytest::alloc_fail_none();
    EXPECT_TRUE(r.rc == 6 && r.cleared && rytest::error_msgnum() == 89);
    EXPECT_NE(rytest::error_text().find("Attempted allocation: 301 bytes"), std::string::npos);
}

}  // namespace
