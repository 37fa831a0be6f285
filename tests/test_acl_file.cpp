// Name resolution, reading a file whole, the cache writer (faults, crashes, links: test_cache_faults and others).
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include "lib_acl_bytes.h"
#include "ry_zo.h"
#include "ryacl_acl_file.h"

namespace {

std::string code(int32_t rc) { return std::to_string(rc) + "/" + std::to_string(rytest::error_msgnum()); }

// The name resolved, or "code/message"; the bytes after the area must survive.
std::string resolve(const std::string &f, const char *user, uid_t *uid) {
    char b[ACL_FNAME_AREA + 64];
    std::memset(b, 0x5a, sizeof b);
    const int32_t rc = sec__get_aclfname(f.c_str(), user, b, uid);
    for (size_t i = ACL_FNAME_AREA; i < sizeof b; ++i) EXPECT_EQ(b[i], 0x5a) << "overrun at " << i;
    return rc ? code(rc) : std::string(b);
}

TEST(AclFname, RelativeAbsoluteOrInTheUsersHomeWithinTheArea) {
    const passwd *pw = getpwuid(geteuid());
    ASSERT_NE(pw, nullptr);
    const std::string user = pw->pw_name, home = pw->pw_dir, hdir = home + (home.back() == '/' ? "" : "/");
    rytest::tmp_dir d;
    char old[ACL_FNAME_AREA], here[ACL_FNAME_AREA];
    ASSERT_TRUE(getcwd(old, sizeof old) && chdir(d.path().c_str()) == 0 && getcwd(here, sizeof here));
    // Directory, separator and name: 4096 characters, the separator counted after a home too.
    const std::string fit(4095 - std::strlen(here), 'n'), hfit(4095 - home.size(), 'n'), abs = "/x//./" + std::string(4090, 'x');
    uid_t uid = 4242;
    EXPECT_EQ(resolve(fit, nullptr, &uid), here + ("/" + fit));
    EXPECT_EQ(resolve(fit + "n", nullptr, &uid), "105/153");
    EXPECT_EQ(resolve(abs, nullptr, &uid), abs);
    EXPECT_EQ(resolve(abs + "x", nullptr, &uid), "105/153");
    ASSERT_EQ(chdir("/"), 0);
    EXPECT_EQ(resolve("acl", nullptr, &uid), "/acl");  // no doubled separator
    ASSERT_EQ(chdir(old), 0);
    for (const std::string &bad : {hfit + "n", std::string("d/acl"), std::string("/etc/acl"), std::string("acl/")})
        EXPECT_EQ(resolve(bad, user.c_str(), &uid), "4/151") << bad.substr(0, 20);
    EXPECT_EQ(resolve("acl", "", &uid), "15/127");  // an empty user is unknown, not the caller
    EXPECT_EQ(uid, 4242u);  // written only on success with a user
    EXPECT_EQ(resolve(hfit, user.c_str(), &uid), hdir + hfit);
    EXPECT_EQ(resolve("acl", user.c_str(), &uid), hdir + "acl");
    EXPECT_EQ(uid, pw->pw_uid);
}

std::function<void()> g_on_read;  // run before each read() of the reader

// "code/message|" and the bytes read with their terminator; a failure or an empty file leaves no buffer.
std::string read_path(const std::string &path, std::function<void()> on_read = {}) {
    g_on_read = std::move(on_read);
    acl__set_file_step_hook([](const char *s, const char *) { if (g_on_read && !std::strcmp(s, "read:read")) g_on_read(); });
    const int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK);
    char junk, *buf = &junk;
    size_t size = 77;
    zo_set_no_error_1();
    std::string r = code(acl__read_acl_file("acl", fd, &buf, &size)) + "|";
    acl__set_file_step_hook(nullptr);
    close(fd);
    EXPECT_TRUE(buf != &junk && (buf != nullptr) == (size != 0)) << path;
    if (buf && buf != &junk) r.append(buf, size + 1);
    if (buf != &junk) std::free(buf);
    return r;
}

// Once the size is taken, the file grows and its name goes to another, or it shrinks.
TEST(AclFileRead, UpToTheSizeOfTheOpenFileOrNothing) {
    rytest::tmp_dir d;
    for (auto [name, text] : {std::pair{"empty", std::string()}, {"short", std::string(1000, 'a')},
                              {"grow", std::string("fi\0st\n", 6)}, {"other", std::string("a much longer replacement\n")}})
        rytest::write_file(d / name, text);
    const int grow = open((d / "grow").c_str(), O_WRONLY | O_APPEND);
    EXPECT_EQ(read_path(d / "empty"), "0/0|");
    EXPECT_EQ(read_path(d / "grow", [&] { (void)!rename((d / "other").c_str(), (d / "grow").c_str()), (void)!write(grow, "x", 1); }),
              std::string("0/0|fi\0st\n", 11));
    close(grow);
    EXPECT_EQ(read_path(d / "short", [&] { (void)!truncate((d / "short").c_str(), 400); }), "37/126|");
    EXPECT_NE(rytest::error_text().find("only 400 bytes out of a total\nof 1000 bytes"), std::string::npos);
}

TEST(AclCache, ExactBytesWithTheAclFilesIdentityOverAMatchingCacheOnly) {
    rytest::tmp_dir d;
    const std::string acl = d / "acl", cache = acl + ".cacl", bytes = std::string("\x01\x00\x02", 3) + std::string(297, 'c');
    auto store = [&](sec_boolean_t force = 1, const std::string &b = "new compiled ACL", const std::string &name = "") {
        sec_acl_buffer_desc desc{static_cast<int32_t>(b.size()), const_cast<char *>(b.data())};
        zo_set_no_error_1();
        return code(sec__cache_aclbuffer((name.empty() ? acl : name).c_str(), &desc, force));
    };
    rytest::write_file(acl, "u:unix:joe:rw\n", 0640);
    EXPECT_TRUE(store(1, "") == "1/0" && rytest::list_dir(d.path()).size() == 1);  // nothing to store
    rytest::write_file(cache, bytes, 0600);
    EXPECT_EQ(store(), "37/137");  // another mode
    if (geteuid() == 0) {
        ASSERT_EQ(chmod(cache.c_str(), 0640) | chown(cache.c_str(), 65534, 0), 0);
        EXPECT_EQ(store(), "37/136");  // another owner
        ASSERT_EQ(chown(cache.c_str(), 0, 65534), 0);
        EXPECT_EQ(store(), "37/136");  // another group
        ASSERT_EQ(chown(acl.c_str(), 65534, 65534) | chown(cache.c_str(), 65534, 65534), 0);
    }
    EXPECT_EQ(rytest::read_file(cache), bytes);  // refused, untouched
    ASSERT_EQ(chmod(cache.c_str(), 0640), 0);
    EXPECT_TRUE(store() == "0/0" && rytest::read_file(cache) == "new compiled ACL");
    struct stat a {}, c {};
    ASSERT_EQ(stat(acl.c_str(), &a) | stat(cache.c_str(), &c), 0);
    EXPECT_TRUE(c.st_uid == a.st_uid && c.st_gid == a.st_gid && c.st_mode == a.st_mode);
    EXPECT_EQ(rytest::list_dir(d.path()).size(), 2u);
    // Set-id and sticky bits are the file's too (given after the owner, whose change may clear them).
    ASSERT_EQ(chmod(acl.c_str(), 07640) | unlink(cache.c_str()), 0);
    EXPECT_EQ(store(), "0/0");
    ASSERT_EQ(stat(acl.c_str(), &a) | stat(cache.c_str(), &c), 0);
    EXPECT_EQ(c.st_mode, a.st_mode);
    std::string name = d.path();  // 4089 characters fit, with the cache name in the area
    while (name.size() + 201 < 4038) ASSERT_EQ(mkdir((name += "/" + std::string(200, 'd')).c_str(), 0700), 0);
    rytest::write_file(name += "/" + std::string(4088 - name.size(), 'a'), "x");
    EXPECT_TRUE(store(1, bytes, name) == "0/0" && rytest::read_file(name + ".cacl") == bytes);
    EXPECT_EQ(store(1, bytes, name + "a"), "37/135");
}

}  // namespace
