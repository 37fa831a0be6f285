// ACL file name resolution: relative, absolute and per-user names within the
// 4097-byte area (guard bytes after it must survive), unknown users,
// allocation failure.
#include <gtest/gtest.h>
#include <pwd.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

struct resolver {
    char b[ACL_FNAME_AREA + 64];
    uid_t uid = 4242;
    int32_t operator()(const std::string &f, const char *user) {
        std::memset(b, 0x5a, sizeof b);
        int32_t rc = sec__get_aclfname(f.c_str(), user, b, &uid);
        for (size_t i = ACL_FNAME_AREA; i < sizeof b; ++i) EXPECT_EQ(b[i], 0x5a) << "overrun at " << i;
        return rc;
    }
    void fails(const std::string &f, const char *user, int32_t rc, int32_t msg) {
        EXPECT_EQ((*this)(f, user), rc) << f.substr(0, 20);
        EXPECT_EQ(rytest::error_msgnum(), msg);
    }
};

TEST(AclFname, NamesWithoutUserAndTheAreaLimit) {
    rytest::tmp_dir d;
    char old[ACL_FNAME_AREA], here[ACL_FNAME_AREA];
    ASSERT_TRUE(getcwd(old, sizeof old) && chdir(d.path().c_str()) == 0 && getcwd(here, sizeof here));
    resolver r;
    EXPECT_EQ(r("../acl", nullptr), 0);
    EXPECT_EQ(r.b, std::string(here) + "/../acl");
    size_t fit = 4096 - 1 - std::strlen(here);  // directory, separator, name: 4096
    EXPECT_EQ(r(std::string(fit, 'n'), nullptr), 0);
    EXPECT_EQ(std::strlen(r.b), 4096u);
    r.fails(std::string(fit + 1, 'n'), nullptr, 105, 153);
    std::string abs = "/x//./" + std::string(4090, 'x');
    EXPECT_EQ(r(abs, nullptr), 0);
    EXPECT_EQ(r.b, abs);
    r.fails(abs + "x", nullptr, 105, 153);
    ASSERT_EQ(chdir("/"), 0);
    EXPECT_EQ(r("acl", nullptr), 0);
    EXPECT_STREQ(r.b, "/acl");  // no doubled separator
    EXPECT_EQ(r.uid, 4242u);  // written only with a user
    ASSERT_EQ(chdir(old), 0);
}

TEST(AclFname, SimpleNameInTheUsersHome) {
    struct passwd *pw = getpwuid(geteuid());
    ASSERT_NE(pw, nullptr);
    std::string user = pw->pw_name, home = pw->pw_dir;
    uid_t want = pw->pw_uid;
    resolver r;
    EXPECT_EQ(r("acl", user.c_str()), 0);
    EXPECT_EQ(r.b, home + (home.back() == '/' ? "" : "/") + "acl");
    EXPECT_EQ(r.uid, want);
    size_t fit = 4096 - 1 - home.size();  // counted with the separator
    EXPECT_EQ(r(std::string(fit, 'n'), user.c_str()), 0);
    r.uid = 4242;
    r.fails(std::string(fit + 1, 'n'), user.c_str(), 4, 151);
    for (const char *bad : {"d/acl", "/etc/acl", "../acl", "acl/"}) r.fails(bad, user.c_str(), 4, 151);
    for (const char *nobody : {"", "no-such-user-ryacl"}) {
        r.fails("acl", nobody, 15, 127);
        EXPECT_NE(rytest::error_text().find("(" + std::string(nobody) + ")"), std::string::npos);
    }
    EXPECT_EQ(r.uid, 4242u);  // no failure touched it

    char dir[ACL_FNAME_AREA];
    EXPECT_EQ(rytest::for_each_alloc_failure([&] { return sec__get_user_info(user.c_str(), &want, dir); },
                                             [&](int32_t rc, long) { EXPECT_TRUE(rc == 6 && rytest::error_msgnum() == 89); }),
              1);
}

}  // namespace
