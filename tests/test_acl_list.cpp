// Listing compiled ACLs as entry records, whole or by type.
#include <gtest/gtest.h>

#include "lib_acl_bytes.h"

namespace {

using namespace libtest;
strings list(const bytes &b, int type = -1, const char *mech = nullptr) {
    sec_buffer_desc d = own(b);
    strings r = libtest::list(d, type, mech);
    drop(d);
    return r;
}

// Beyond the fuzz_acl_ops model: a second sub-ACL of a mechanism in another case (made outside), refused buffers.
TEST(List, WholeAclInBufferOrderAndByTypeAndMechanism) {
    const bytes acl = make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}}),
                                subacl(16, "", {{4, "staff"}}), subacl(4, "Unix", {{5, "u"}})});
    const struct { bytes acl; int type; const char *mech; strings want; } rows[] = {
        {acl, -1, nullptr, {"0/0", "4:unix:Alice:3", "4:unix:bob:1", "2::-:1", "16::staff:4", "4:Unix:u:5"}},
        {acl, 4, nullptr, {"0/0", "4:unix:Alice:3", "4:unix:bob:1", "4:Unix:u:5"}},
        {acl, 4, "UNIX", {"0/0", "4:unix:Alice:3", "4:unix:bob:1"}},  // only the first sub-ACL of the mechanism
        {acl, 16, "ignored", {"0/0", "16::staff:4"}}, {{}, -1, nullptr, {"0/0"}},
        {{0x84, 1, 2, 0, 0}, -1, nullptr, {"42/96"}}, {{0x85, 2, 2, 0, 0}, 4, nullptr, {"42/96"}},
        {{0x85, 1, 2, 0}, 4, nullptr, {"42/106"}},
    };
    for (const auto &r : rows) EXPECT_EQ(list(r.acl, r.type, r.mech), r.want) << r.type;
}

}  // namespace
