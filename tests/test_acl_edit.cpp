// Editing compiled ACLs in place: add, add2 (no update), delete, on the direct byte road and the tree road alike.
#include <gtest/gtest.h>

#include "lib_acl_bytes.h"
#include "ryacl_acl_edit.h"

namespace {

using namespace libtest;

struct op { char kind; unsigned type; uint32_t perm; const char *mech, *id, *want = "0/0"; };  // kind: + 2 -
std::string edit(sec_buffer_desc &d, const op &o) {
    sec_acle_desc e = entry(o.type, o.perm, o.mech, o.id);
    const int32_t rc = o.kind == '-' ? sec_del_acle_from_acl(&e, &d) : o.kind == '2' ? sec_add_acle_to_acl2(&e, &d)
                                                                                     : sec_add_acle_to_acl(&e, &d);
    return code(rc);
}
// The edits in turn on the direct road and the tree road: each gives its code, a failure leaves every byte, and both
// roads give the same codes and bytes at every step.  The bytes left.
bytes apply(const bytes &start, const std::vector<op> &ops) {
    std::vector<std::pair<std::string, bytes>> trail[2];
    for (int road = 0; road < 2; ++road) {
        acl__edit_direct_enabled = road == 0;
        sec_buffer_desc d = own(start);
        for (const op &o : ops) {
            const bytes before = view(d);
            const std::string rc = edit(d, o);
            EXPECT_TRUE(rc == o.want && (rc == "0/0" || view(d) == before)) << o.kind << o.type << o.id << " " << rc;
            trail[road].emplace_back(rc, view(d));
        }
        drop(d);
    }
    acl__edit_direct_enabled = true;
    EXPECT_TRUE(trail[0] == trail[1]);
    return trail[0].empty() ? start : trail[0].back().second;
}

// Beyond the fuzz_acl_ops model: exact bytes and messages, ACLs made outside, headers, limits, refused entries.
TEST(Edit, AddAdd2DeleteBytesAndCodes) {
    const bytes ex = worked_example();
    EXPECT_EQ(apply({}, {{'+', 4, 3, "unix", "Alice"}, {'+', 4, 1, "UNIX", "bob"}, {'+', 2, 1, "", ""}}), ex);
    // Replacing keeps the place (mask 0 clears); add2 never replaces; a last entry takes its sub-ACL along.
    EXPECT_EQ(apply(ex, {{'+', 4, 0, "Unix", "ALICE"}, {'+', 2, 0x30, "", ""}, {'2', 4, 7, "unix", "BOB", "43/144"},
                         {'2', 2, 7, "", "", "43/160"}, {'+', 16, 1, "", "g"}, {'2', 16, 2, "", "g", "43/161"}, {'-', 16, 0, "", "G"}}),
              make_acl({subacl(4, "unix", {{0, "Alice"}, {1, "bob"}}), subacl(2, "", {{0x30, ""}})}));
    EXPECT_EQ(apply(ex, {{'-', 4, 0xffff, "UNIX", "alice"}, {'-', 2, 0, "", ""}, {'-', 4, 0, "unix", "carol", "18/105"},
                         {'-', 4, 0, "nfs", "bob", "18/105"}}), make_acl({subacl(4, "unix", {{1, "bob"}})}));
    EXPECT_NE(rytest::error_text().find("mechanism (nfs), and the identifier (bob)"), std::string::npos);
    EXPECT_EQ(apply({}, {{'-', 2, 0, "", "", "42/93"}}), bytes{});
    EXPECT_EQ(apply(make_acl({subacl(16, "", {})}), {{'-', 16, 0, "", "staff", "43/105"}}), make_acl({subacl(16, "", {})}));
    // Made outside out of order: comes back sorted either way.
    EXPECT_EQ(apply(make_acl({subacl(4, "unix", {{1, "b"}, {2, "a"}, {3, "B"}})}), {{'+', 4, 4, "unix", "c"}}),
              make_acl({subacl(4, "unix", {{2, "a"}, {3, "b"}, {4, "c"}})}));
    // Entries and headers are checked before anything; the count of sub-ACLs has 16 bits.
    EXPECT_EQ(apply(ex, {{'+', 3, 1, "unix", "x", "43/103"}, {'-', 3, 1, "unix", "x", "43/103"},
                         {'+', 4, 1, "", "x", "43/104"}, {'2', 4, 1, "", "x", "43/104"}, {'-', 4, 1, "", "x", "43/104"},
                         {'+', 16, 1, "", nullptr, "43/104"}, {'-', 16, 1, "", nullptr, "43/104"}}), ex);
    auto at = [&](size_t off, unsigned char v) { bytes b = ex; b[off] = v; return b; };
    for (auto [b, want] : {std::pair{at(0, 0x84), "42/100"}, {at(1, 2), "42/101"}, {at(2, 1), "42/102"}})
        EXPECT_EQ(apply(b, {{'+', 4, 1, "unix", "x", want}, {'-', 4, 0, "unix", "bob", want}}), b);
    std::vector<bytes> full(65535, subacl(2, "", {{1, ""}})), after = full;
    after[0] = subacl(2, "", {{3, ""}});
    EXPECT_EQ(apply(make_acl(full), {{'+', 16, 1, "", "g", "42/93"}, {'+', 2, 3, "", ""}}), make_acl(after));
    sec_acle_desc unterminated = entry(4, 1, "", "x");
    std::memset(unterminated.mech, 'm', sizeof unterminated.mech);
    sec_buffer_desc d = own(ex);
    EXPECT_TRUE(with_msg(sec_add_acle_to_acl(&unterminated, &d)) == rc_msg(ACL_RC_BAD_ACLE, 104) && view(d) == ex);
    drop(d);
}

}  // namespace
