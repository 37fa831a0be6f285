// Listing compiled ACLs as entry records, whole or by type.
#include <gtest/gtest.h>

#include <span>

#include "lib_acl_bytes.h"

namespace {

using namespace libtest;
using strings = std::vector<std::string>;

// "code/message", then "type:mech:id:perm" per entry; an empty list has no array, a failure leaves it or empties it.
strings list(const bytes &b, int type = -1, const char *mech = nullptr) {
    sec_buffer_desc d = own(b);
    sec_acle_list_desc l{-1, reinterpret_cast<sec_acle_t *>(0x1)};
    const int32_t rc = type < 0 ? sec_list_acl(&d, &l) : sec_list_acl_by_type(&d, static_cast<unsigned char>(type), mech, &l);
    strings r{std::to_string(rc) + "/" + std::to_string(rc ? rytest::error_msgnum() : 0)};
    if (rc && l.acles == reinterpret_cast<sec_acle_t *>(0x1)) l = {0, nullptr};
    EXPECT_EQ(l.count == 0, l.acles == nullptr) << l.count;
    for (const sec_acle_desc *e : std::span(l.acles, l.acles ? size_t(l.count) : 0))
        r.push_back(std::to_string(e->type) + ":" + e->mech + ":" + (e->id ? e->id : "-") + ":" + std::to_string(e->perm));
    sec_release_aclelist(&l);
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
