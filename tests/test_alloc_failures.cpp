// The main flows with each allocation failing in turn: 6 and message 89, outputs as documented, no leak.
#include <fcntl.h>
#include <gtest/gtest.h>

#include <dlfcn.h>
#include <pwd.h>

#include <ctime>
#include <functional>

#include "aclfck.h"  // -s in process, where the hook reaches
#include "ryacl_error.h"
#include "lib_acl_bytes.h"
#include "ry_zo_int.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_acl_edit.h"
#include "ryacl_init.h"
#include "ryacl_trace.h"
#include "ryacl_utils.h"
#include "ryacl_utils_codeset.h"

namespace {

using namespace libtest;

void expect_no_memory(int32_t rc, long nth, const std::string &what) {
    EXPECT_TRUE(rc == ACL_RC_NO_MEMORY && rytest::error_code() == ACL_RC_NO_MEMORY && rytest::error_msgnum() == 89)
        << what << ", allocation " << nth << ": rc " << rc << "\n" << rytest::error_text();
}
long sweep(const std::string &name, const std::function<int32_t()> &flow,
           const std::function<void(int32_t, long)> &check, const std::function<void()> &reset = {}) {
    const long sites = rytest::for_each_alloc_failure(flow, check, reset);
    std::printf("[ alloc    ] %-44s %3ld sites\n", name.c_str(), sites);
    return sites;
}

// Nine entries in five sub-ACLs, older than any cache written from now on.
struct acl_file {
    rytest::tmp_dir dir;
    std::string path = dir / "svc.acl", cache = path + ".cacl";
    bytes compiled;
    acl_file() {
        rytest::write_file(path, "n r\no rw\nu unix alice@node1 rw\nu UNIX bob@node1 r\nu krb5 carol@REALM x\n"
                                 "e unix alice rw\ne unix bob r\ng staff rlq\ng admin rwcx\n");
        struct timespec past[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
        utimensat(AT_FDCWD, path.c_str(), past, 0);
        sec_buffer_desc d{0, nullptr};
        EXPECT_EQ(sec_read_acl_file(path.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &d, nullptr), 0);
        compiled = view(d);
        sec_release_acl(&d);
    }
};

// A failed read or check stores nothing; a cache that cannot be read into memory is passed over.
// ryaclfck -s runs a quiet pass first: a failure there is never shown, the ordinary check runs
// instead and stores the cache.  The ordinary check is swept with a trace level set, which skips
// the quiet pass.
TEST(AllocFailures, ReadingAndCheckingStoreNothingOnFailure) {
    acl_file f;
    rytest::tmp_dir logs;
    const int saved = dup(2), log = open((logs / "err").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    dup2(log, 2);
    sec_buffer_desc acl{0, nullptr};
    enum { READ, CHECK, QUIET, FROM_CACHE };
    const char *name[] = {"sec_read_acl_file (text, cache write)", "ryaclfck -s (traced: the ordinary check)", "ryaclfck -s",
                          "sec_read_acl_file (cache, convert)"};
    ASSERT_EQ(setenv("RYACL_TRACE_FILE", "/dev/null", 1), 0);
    acl::trace::level(acl::trace::PERF);  // registered now, so the level set below stays
    for (int road : {READ, CHECK, QUIET, FROM_CACHE}) {
        acl__trace_detail_levels[acl::trace::PERF] = road == CHECK ? 1 : 0;
        const uint32_t flags = road == READ ? SEC_ACLF_WRITE_CACHE : SEC_ACLF_CONVERT_CACHE;
        uint32_t rflags = 0;
        long fallbacks = 0;
        auto run = [&] {
            if (road == CHECK || road == QUIET)
                return aclfck__bulk_aclfile(f.path.c_str(), nullptr, ACLFCK_CACHE);
            return sec_read_acl_file(f.path.c_str(), nullptr, nullptr, flags, &acl, &rflags);
        };
        const long n = sweep(name[road], run, [&](int32_t rc, long nth) {
            const std::string err = rytest::read_file(logs / "err");
            if (road == FROM_CACHE && rc == 0 && ++fallbacks)
                EXPECT_TRUE(rflags == SEC_ACLF_FROM_TEXT && view(acl) == f.compiled);
            else if (road == CHECK)
                EXPECT_TRUE(rc == ACL_RC_NO_MEMORY && err.find("4471-102") != std::string::npos) << err;
            else if (road == QUIET)
                EXPECT_TRUE(rc == 0 && err.empty() && rytest::read_file(f.cache) == std::string(f.compiled.begin(), f.compiled.end()));
            else
                expect_no_memory(rc, nth, name[road]);
            EXPECT_TRUE(((acl.length == 0 && !acl.value) || (rc == 0 && fallbacks)) &&
                        rytest::list_dir(f.dir.path()).size() == (road == FROM_CACHE || road == QUIET ? 2u : 1u))
                << name[road] << " " << nth;
        }, [&] {
            sec_release_acl(&acl);
            EXPECT_TRUE(road == FROM_CACHE || unlink(f.cache.c_str()) == 0 || errno == ENOENT);
            EXPECT_EQ(ftruncate(log, 0), 0);
        });
        const std::string stored = rytest::read_file(f.cache);  // the cache written by the last, unfailed run
        EXPECT_TRUE(bytes(stored.begin(), stored.end()) == f.compiled &&
                    (road == CHECK || road == QUIET || view(acl) == f.compiled));
        // The cache road allocates only the buffer it reads into.
        EXPECT_TRUE(road == FROM_CACHE ? n == 1 && fallbacks == 1 && rflags == SEC_ACLF_CONVERT_CACHE
                                       : n > 3 && (road == CHECK || road == QUIET || rflags & SEC_ACLF_WRITE_CACHE))
            << name[road];
    }
    acl__trace_detail_levels[acl::trace::PERF] = 0;
    dup2(saved, 2), close(saved), close(log);
    sec_release_acl(&acl);
}

// Each edit (op 0 add, 1 add2, 2 delete; rc unfailed) on both roads leaves the ACL as it was, or a delete done.
TEST(AllocFailures, EditsLeaveTheAclAsItWasOrDone) {
    const bytes base = acl_file().compiled;
    const struct { const char *what; int op; unsigned char type; const char *mech, *id; int32_t rc; } edits[] = {
        {"add to a user sub-ACL", 0, 4, "unix", "carl@node1", 0}, {"add a new sub-ACL", 0, 4, "hba2", "dora@node2", 0},
        {"add to the expanded sub-ACL", 0, 8, "unix", "zed", 0},   {"add a group", 0, 16, "", "ops", 0},
        {"replace a permission", 0, 16, "", "STAFF", 0},           {"add2 a new user", 1, 4, "krb5", "abe@REALM", 0},
        {"add2 a duplicate", 1, 4, "unix", "ALICE@node1", ACL_RC_BAD_ACLE}, {"delete a user", 2, 4, "unix", "bob@node1", 0},
        {"delete the last of a sub-ACL", 2, 4, "krb5", "carol@REALM", 0},
        {"delete an expanded entry", 2, 8, "unix", "alice", 0},    {"delete anyother", 2, 2, "", nullptr, 0},
        {"add to an empty descriptor", 0, 16, "", "staff", 0},
    };
    int32_t (*const ops[])(sec_acle_t, sec_acl_buffer_t) = {sec_add_acle_to_acl, sec_add_acle_to_acl2,
                                                            sec_del_acle_from_acl};
    for (bool direct : {true, false}) {
        acl__edit_direct_enabled = direct;
        for (const auto &e : edits) {
            const std::string name = std::string(e.what) + (direct ? "" : " (tree road)");
            const bytes start = std::strstr(e.what, "empty") ? bytes{} : base;
            sec_acle_desc d = entry(e.type, 5, e.mech, e.id);
            auto run = [&](sec_buffer_desc &b) { return ops[e.op](&d, &b); };
            sec_buffer_desc done = own(start), b{0, nullptr};
            EXPECT_EQ(run(done), e.rc) << name;
            sweep(name, [&] { return run(b); }, [&](int32_t rc, long nth) {
                expect_no_memory(rc, nth, name);
                const bool as_was = view(b) == start && !b.value == start.empty();
                EXPECT_TRUE(as_was || (e.op == 2 && view(b) == view(done))) << nth;  // a delete's shrink failed
            }, [&] { drop(b), b = own(start); });
            EXPECT_EQ(view(b), view(done)) << name;
            drop(b), drop(done);
        }
    }
    acl__edit_direct_enabled = true;
}

// Listings, entries, conversions: a failure leaves every output as it was.  A conversion handle
// that failed to open stays absent (129 for good): seen in a child, before this process opens its own.
TEST(AllocFailures, OutputsStayUntouched) {
    ASSERT_EQ(acl__to_utf8_hdl, nullptr) << "the conversion handles are opened here";
    auto handle_stays_absent = [] {
        sec_acle_t e = nullptr;
        char *out = nullptr;
        size_t inlen = 6, outlen = 0;
        rytest::alloc_fail_nth(1);  // a first conversion allocates the handle first
        const int32_t first = acl__convert_to_utf8("staff", &inlen, &out, &outlen), msg = rytest::error_msgnum();
        rytest::alloc_fail_none();
        const int32_t again = sec_create_acle(SEC_ACLE_TYPE_GROUP, 1, nullptr, "staff", &e);
        _exit(first == ACL_RC_CODESET && msg == 129 && again == ACL_RC_CODESET && rytest::error_msgnum() == 129 ? 0 : 1);
    };
    EXPECT_EXIT(handle_stays_absent(), ::testing::ExitedWithCode(0), "");
    const bytes b = acl_file().compiled;
    sec_buffer_desc acl = own(b), d{0, nullptr}, e{77, nullptr};
    sec_acle_list_desc list{0, nullptr};
    sec_acle_t shown = nullptr, made = nullptr;
    char *mech = nullptr, *id = nullptr;
    ASSERT_EQ(sec_create_acle(SEC_ACLE_TYPE_USER, 3, "unix", "alice@node1", &shown), 0);
    ASSERT_EQ(sec_display_acle_id(shown, &mech, &id), 0);  // both conversion handles open: not the flows' sites
    auto reset = [&] {
        sec_release_aclelist(&list), sec_release_acle(made), std::free(mech), std::free(id), sec_release_acl(&d), sec_release_acl(&e);
        made = nullptr, mech = id = nullptr, e = {77, nullptr};
    };
    auto pristine = [&] {
        return !list.count && !list.acles && !made && !mech && !id && !d.length && !d.value && e.length == 77 && !e.value;
    };
    auto by_type = [&](unsigned char t, const char *m) { return [&, t, m] { return sec_list_acl_by_type(&acl, t, m, &list); }; };
    auto listed = [&](int32_t n) { return [&, n] { return list.count == n; }; };
    auto create = [&](const char *s) { return [&, s] { return sec_create_acle(4, 3, "unix", s, &made); }; };
    auto made_as = [&](const char *s) { return [&, s] { return made && std::strcmp(made->id, s) == 0; }; };
    const struct { const char *name; std::function<int32_t()> run; std::function<bool()> done; long min, max; } flows[] = {
        {"sec_list_acl", [&] { return sec_list_acl(&acl, &list); }, listed(9), 2, 99},
        {"sec_list_acl_by_type (user, every mech)", by_type(4, nullptr), listed(3), 2, 99},
        {"sec_list_acl_by_type (user, unix)", by_type(4, "Unix"), listed(2), 2, 99},
        {"sec_list_acl_by_type (group)", by_type(16, nullptr), listed(2), 2, 99},
        {"sec_create_acle alice@fe80:0:0::1", create("alice@fe80:0:0::1"), made_as("alice@fe80::1"), 1, 99},
        {"sec_create_acle alice@node1", create("alice@node1"), made_as("alice@node1"), 1, 99},
        {"sec_display_acle_id", [&] { return sec_display_acle_id(shown, &mech, &id); },
         [&] { return mech && id && std::strcmp(mech, "unix") == 0 && std::strcmp(id, "alice@node1") == 0; }, 2, 99},
        {"sec_read_acl_from_data", [&] { return sec_read_acl_from_data(static_cast<int32_t>(b.size()), b.data(), &d); },
         [&] { return view(d) == b; }, 1, 1},
        {"sec_convert_acl_to_host", [&] { return sec_convert_acl_to_host(1, &acl); }, [&] { return view(acl) == b; }, 0, 0},
        {"sec_create_empty_acl", [&] { return sec_create_empty_acl(&e); }, [&] { return e.length == 5; }, 1, 1},
    };
    for (const auto &f : flows) {
        reset();
        const long n = sweep(f.name, f.run, [&](int32_t rc, long nth) {
            expect_no_memory(rc, nth, f.name);
            EXPECT_TRUE(pristine() && view(acl) == b) << f.name << " " << nth;
        }, reset);
        EXPECT_TRUE(n >= f.min && n <= f.max && f.done()) << f.name << ": " << n << " sites";
    }
    reset();
    sec_release_acle(shown), drop(acl);
}

// With no memory at all, not even for the copies the report makes, the
// checker still prints message 89 whole: what the report needs is kept aside.
TEST(AllocFailures, CheckerReports89WithNoMemoryLeft) {
    acl_file f;
    rytest::tmp_dir logs;
    static long report_asked;
    report_asked = 0;
    const int saved = dup(2), log = open((logs / "err").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    dup2(log, 2);
    acl__set_alloc_hook([](size_t) { return false; });
    zo::set_alloc_hook([](size_t) { return ++report_asked, false; });
    const int32_t rc = aclfck__bulk_aclfile(f.path.c_str(), nullptr, 0);
    std::fflush(stderr);
    zo::set_alloc_hook(nullptr);
    acl__set_alloc_hook(nullptr);
    dup2(saved, 2), close(saved), close(log);
    const std::string err = rytest::read_file(logs / "err"), text = acl::msg_text(89);
    EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
    EXPECT_GE(report_asked, 2);  // the record's copy and the text's were both refused
    EXPECT_EQ(err.rfind(text.substr(0, text.find("%1$s")), 0), 0u) << err;
    EXPECT_NE(err.find("terminating these processes.\n\n"), std::string::npos) << err;
}

// getpwnam_r in front of the C library's: with a need set, a buffer smaller
// than that is refused with ERANGE, as for an entry longer than suggested.
size_t g_pw_need = 0;
int g_pw_calls = 0;

}  // namespace

extern "C" int getpwnam_r(const char *name, struct passwd *pwd, char *buf, size_t buflen, struct passwd **result) {
    using lookup = int (*)(const char *, struct passwd *, char *, size_t, struct passwd **);
    static const auto real = reinterpret_cast<lookup>(dlsym(RTLD_NEXT, "getpwnam_r"));
    ++g_pw_calls;
    if (buflen < g_pw_need) {
        *result = nullptr;
        return ERANGE;
    }
    return real(name, pwd, buf, buflen, result);
}

namespace {

// A password entry longer than the first buffer is found with a larger one;
// each allocation failing on the way reports 89.
TEST(AllocFailures, UserWhoseEntryOutgrowsTheSuggestedBuffer) {
    long suggested = sysconf(_SC_GETPW_R_SIZE_MAX);
    g_pw_need = 4 * static_cast<size_t>(suggested > 0 ? suggested : 16384) + 1;  // two doublings past the first
    uid_t uid = 1;
    char home[ACL_FNAME_AREA] = {};
    g_pw_calls = 0;
    EXPECT_EQ(sec__get_user_info("root", &uid, home), 0) << rytest::error_text();
    EXPECT_EQ(g_pw_calls, 3);
    EXPECT_EQ(uid, 0u);
    EXPECT_STREQ(home, "/root");
    sweep("sec__get_user_info (entry beyond the first buffer)", [&] { return sec__get_user_info("root", &uid, home); },
          [&](int32_t rc, long nth) { expect_no_memory(rc, nth, "sec__get_user_info"); });
    g_pw_need = 0;
}

int32_t same_id(const char *a, const char *b) { return std::strcmp(a, b); }

// A failed growth of the registry registers nothing and loses nothing.
TEST(AllocFailures, HandlerRegistration) {
    long total = 0;
    std::vector<std::string> mechs;
    auto handler = [](const std::string &m) {
        sec_acl_id_handler h = nullptr;
        return sec__get_id_handler(SEC_ID_HANDLER_USER, m.c_str(), &h), h;
    };
    for (int k = 0; k < 40; ++k) {
        mechs.push_back("alloc" + std::to_string(k));
        total += rytest::for_each_alloc_failure(
            [&] { return sec__register_id_handler(SEC_ID_HANDLER_USER, mechs.back().c_str(), same_id); },
            [&](int32_t rc, long nth) {
                expect_no_memory(rc, nth, mechs.back());
                EXPECT_EQ(handler(mechs.back()), nullptr);
            });
        for (const std::string &m : mechs) EXPECT_EQ(handler(m), &same_id) << m;
    }
    std::printf("[ alloc    ] %-44s %3ld sites\n", "sec__register_id_handler (40 registrations)", total);
    EXPECT_GE(total, 5);  // the doublings up to 64 slots
}

}  // namespace

// Many small sub-ACLs take their blocks from chunks of growing size, the
// large ones huge-page aligned: when one of those cannot be had, the read
// fails cleanly (and leaks nothing, as the sanitizer run checks).
TEST(AllocFailures, LargeChunkOfManySmallSubacls) {
    rytest::tmp_dir dir;
    std::string text;
    for (int m = 0; m < 30000; ++m)
        for (const char *who : {"ann", "bob"}) text += "u m" + std::to_string(m) + " " + who + " r\n";
    rytest::write_file(dir / "many.acl", text);
    sec_buffer_desc acl{0, nullptr};
    acl__set_alloc_hook([](size_t n) { return n < (size_t{2} << 20); });
    const int32_t rc = sec_read_acl_file((dir / "many.acl").c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &acl, nullptr);
    acl__set_alloc_hook(nullptr);
    expect_no_memory(rc, 0, "a 2 MiB chunk");
    EXPECT_TRUE(acl.length == 0 && acl.value == nullptr);
    EXPECT_EQ(sec_read_acl_file((dir / "many.acl").c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &acl, nullptr), 0);
    sec_release_acl(&acl);
}
