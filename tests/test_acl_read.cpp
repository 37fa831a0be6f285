// Reading an ACL file into a compiled ACL, with and without its cache file.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <ctime>
#include <functional>
#include <string>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

const char kText[] = "# sample\no r\nu unix bob rw\nu unix Alice r\n";
// What kText compiles to: sub-ACLs in reverse order of first appearance.
const bytes kCompiled = make_acl({subacl(4, "unix", {{1, "Alice"}, {3, "bob"}}), subacl(2, "", {{1, ""}})});
const bytes kMarker = make_acl({subacl(1, "", {{7, ""}})});  // a cache told apart by its contents

struct fixture {
    rytest::tmp_dir dir;
    std::string acl = dir / "svc.acl", cacl = acl + ".cacl";
    time_t now = time(nullptr);
    explicit fixture(const std::string &text = kText) { put(acl, std::string(text), 100, 0644); }
    // Written with the text file's owner and group, `age` seconds old.
    void put(const std::string &path, const std::string &content, time_t age, mode_t mode) {
        rytest::write_file(path, content, mode);
        chmod(path.c_str(), mode);
        struct timespec ts[2] = {{now - age, 0}, {now - age, 0}};
        ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), ts, 0), 0) << path;
    }
    void cache(const bytes &b, time_t age = 10, mode_t mode = 0644) {
        put(cacl, std::string(b.begin(), b.end()), age, mode);
    }
    struct result { int32_t rc; bytes acl; uint32_t rflags; bool empty; };
    result read(uint32_t flags) {
        sec_buffer_desc d{-1, reinterpret_cast<void *>(0x1)};
        uint32_t rflags = 0xdead;
        result r{sec_read_acl_file(acl.c_str(), nullptr, nullptr, flags, &d, &rflags), {}, rflags,
                 d.length == 0 && d.value == nullptr};
        if (!r.empty && d.value != reinterpret_cast<void *>(0x1)) {
            r.acl = view(d);
            sec_release_acl(&d);
        }
        return r;
    }
};

TEST(ReadFile, TextOnlyThenTheCacheItWrote) {
    fixture f;
    auto r = f.read(0);  // no cache file: the text, silently
    ASSERT_EQ(r.rc, 0);
    EXPECT_EQ(r.acl, kCompiled);
    EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT);
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_FALSE(rytest::file_exists(f.cacl));

    r = f.read(SEC_ACLF_WRITE_CACHE | SEC_ACLF_CONVERT_CACHE | 0x100);
    ASSERT_EQ(r.rc, 0);
    EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT | SEC_ACLF_WRITE_CACHE | 0x100);
    EXPECT_EQ(rytest::read_file(f.cacl), std::string(kCompiled.begin(), kCompiled.end()));
    r = f.read(SEC_ACLF_WRITE_CACHE);  // now the cache serves; 0x2 is dropped
    EXPECT_EQ(r.acl, kCompiled);
    EXPECT_EQ(r.rflags, 0u);
}

TEST(ReadFile, CacheUsedOnlyWhenCurrentAndMatching) {
    const bytes garbage = {0x85, 1, 2, 1, 0, 9};
    struct path { const char *what; uint32_t flags; std::function<void(fixture &)> setup; bool from_cache;
                  uint32_t rflags; } const paths[] = {
        {"used", 0, [](fixture &f) { f.cache(kMarker); }, true, 0},
        {"used with 0x4", 4, [](fixture &f) { f.cache(kMarker); }, true, 4},
        {"reversed, converted", 4, [](fixture &f) { f.cache(reversed(kMarker)); }, true, 4},
        {"same second is stale", 4, [](fixture &f) { f.cache(kMarker, 100); }, false, 1},
        {"older", 0, [](fixture &f) { f.cache(kMarker, 200); }, false, 1},
        {"mode differs", 4, [](fixture &f) { f.cache(kMarker, 10, 0640); }, false, 1},
        {"owner differs", 4, [](fixture &f) {
             f.cache(kMarker);
             ASSERT_EQ(chown(f.cacl.c_str(), 4242, static_cast<gid_t>(-1)), 0);
         }, false, 1},
        {"empty cache", 4, [](fixture &f) { f.cache({}); }, false, 1},
        {"fails verification", 4, [&](fixture &f) { f.cache(garbage); }, false, 1},
        {"unverified bytes as they are", 0, [&](fixture &f) { f.cache(garbage); }, true, 0},
        {"text asked for", 1, [](fixture &f) { f.cache(kMarker); }, false, 1},
        {"0x1|0x2 with a newer cache", 3, [](fixture &f) { f.cache(kMarker); }, false, 1},
        {"0x2 with a mismatched cache", 2, [](fixture &f) { f.cache(kMarker, 10, 0600); }, false, 1},
        {"0x2 with a stale cache", 2, [](fixture &f) { f.cache(kMarker, 200); }, false, 3},
    };
    for (const path &p : paths) {
        fixture f;
        p.setup(f);
        const std::string before = rytest::read_file(f.cacl);
        auto r = f.read(p.flags);
        ASSERT_EQ(r.rc, 0) << p.what;
        EXPECT_EQ(rytest::error_code(), 0) << p.what;
        EXPECT_EQ(r.rflags, p.rflags) << p.what;
        EXPECT_EQ(r.acl == kCompiled, !p.from_cache) << p.what;
        if (p.from_cache && p.flags & 4) {
            EXPECT_EQ(r.acl, kMarker) << p.what;
        }
        if (!(p.rflags & SEC_ACLF_WRITE_CACHE)) {
            EXPECT_EQ(rytest::read_file(f.cacl), before) << p.what << ": the cache was rewritten";
        }
    }
}

// The name looked at is not trusted at open: a cache swapped in between,
// or a text file gone, is never read; the message names the text file.
TEST(ReadFile, NamesReplacedBetweenLookAndOpen) {
    static std::string target, swap_in;
    acl__set_file_step_hook([](const char *step, const char *path) {
        if (std::string(step) != "read:open" || target != path) return;
        if (swap_in.empty()) unlink(path);
        else rename(swap_in.c_str(), path);
    });
    {
        fixture f;
        f.cache(kMarker);
        target = f.cacl;
        swap_in = f.dir / "other";
        f.put(swap_in, std::string(5, '\0'), 10, 0644);  // alike in all but identity
        auto r = f.read(0);
        EXPECT_EQ(r.rc, 0);
        EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT);
        EXPECT_EQ(r.acl, kCompiled);
    }
    fixture f;
    f.cache({0x85, 1, 2, 1, 0});  // refused, so the text is opened
    target = f.acl;
    swap_in.clear();
    auto r = f.read(SEC_ACLF_CONVERT_CACHE);
    acl__set_file_step_hook(nullptr);
    EXPECT_EQ(with_msg(r.rc), rc_msg(ACL_RC_FILE_ERROR, 124));
    const std::string msg = rytest::error_text();
    EXPECT_NE(msg.find(f.acl + "."), std::string::npos) << msg;
    EXPECT_EQ(msg.find(".cacl"), std::string::npos) << msg;
}

TEST(ReadFile, EmptyFilesParseFailuresAndParameters) {
    {
        fixture f("");
        f.cache(kMarker);
        auto r = f.read(SEC_ACLF_WRITE_CACHE | 0x40);
        EXPECT_EQ(r.rc, 0);
        EXPECT_TRUE(r.empty);
        EXPECT_EQ(r.rflags, SEC_ACLF_WRITE_CACHE | 0x40u);  // nothing was looked at
    }
    {
        fixture f("# only\n\n   # comments\n");
        auto r = f.read(SEC_ACLF_WRITE_CACHE);
        EXPECT_EQ(r.rc, 0);
        EXPECT_TRUE(r.empty);
        EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT);
        EXPECT_FALSE(rytest::file_exists(f.cacl));  // nothing to store
    }
    fixture f("o r\nq bad line\n");
    auto r = f.read(0);
    EXPECT_NE(r.rc, 0);
    EXPECT_EQ(rytest::error_code(), r.rc);
    EXPECT_TRUE(r.empty);

    sec_buffer_desc d{3, reinterpret_cast<void *>(0x1)};
    EXPECT_EQ(sec_read_acl_file(f.acl.c_str(), "", nullptr, 0, nullptr, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 5"), std::string::npos);
    EXPECT_EQ(with_msg(sec_read_acl_file(f.acl.c_str(), "", nullptr, 0, &d, nullptr)), rc_msg(ACL_RC_BAD_ARGS, 121));
    EXPECT_EQ(d.length, 3);  // refused parameters leave the descriptor
    const std::string missing = f.dir / "missing.acl";
    EXPECT_EQ(with_msg(sec_read_acl_file(missing.c_str(), nullptr, nullptr, 0, &d, nullptr)),
              rc_msg(ACL_RC_FILE_ERROR, 122));
    EXPECT_TRUE(d.length == 0 && d.value == nullptr);
}

}  // namespace
