// The dump: which text goes to which stream, with which empty lines.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "ryacl_acl_buffer.h"
#include "ryacl_acl_dump.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

using bytes = std::vector<unsigned char>;

const bytes kExample = {0x85, 0x01, 0x02, 0x02, 0x00, 0x27, 0x00, 0x00, 0x00, 0x04, 0x02, 0x00, 0x00,
                        0x00, 0x05, 'u',  'n',  'i',  'x',  0x00, 0x01, 0x03, 0x00, 0x00, 0x00, 0x06,
                        0x00, 'A',  'l',  'i',  'c',  'e',  0x00, 0x01, 0x01, 0x00, 0x00, 0x00, 0x04,
                        0x00, 'b',  'o',  'b',  0x00, 0x11, 0x00, 0x00, 0x00, 0x02, 0x01, 0x00, 0x00,
                        0x00, 0x00, 0x01, 0x01, 0x00, 0x00, 0x00, 0x00, 0x00};

struct captured {
    std::string out, err;
};

template <class F>
captured capture(F &&f) {
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    f();
    captured c;
    c.err = testing::internal::GetCapturedStderr();
    c.out = testing::internal::GetCapturedStdout();
    return c;
}

// Dump the bytes from a heap block of exactly their length.
captured dump(const bytes &b) {
    auto *p = static_cast<unsigned char *>(std::malloc(b.size() ? b.size() : 1));
    if (!b.empty()) std::memcpy(p, b.data(), b.size());
    sec_buffer_desc acl{static_cast<int32_t>(b.size()), p};
    captured c = capture([&] { sec__dump_acl(&acl); });
    std::free(p);
    return c;
}

TEST(AclDump, WorkedExampleByteForByte) {
    acl::set_error(ACL_RC_BAD_ACL, 97, ACL_LOC_ACL);  // pending before: cleared by the dump
    captured c = dump(kExample);
    EXPECT_EQ(c.err,
              "ACL descriptor: 61 byte(s) long\n"
              "\tVersion: 1\n"
              "\tByte Ordering: 2\n"
              "\tNumber of sub-ACLs: 2\n"
              "\tSubacl:\n"
              "\t(length = 39 byte(s); type = 4; mech = unix; ACLE count = 2)\n"
              "\n"
              "\t\ttype = u; mech = unix; id = Alice; permission = rw\n"
              "\t\ttype = u; mech = unix; id = bob; permission = r\n"
              "\tSubacl:\n"
              "\t(length = 17 byte(s); type = 2; mech = ; ACLE count = 1)\n"
              "\n"
              "\t\ttype = o; permission = r\n");
    EXPECT_EQ(c.out, "");
    EXPECT_EQ(rytest::error_code(), 0);

    EXPECT_EQ(dump(bytes{0x85, 1, 2, 0, 0}).err,
              "ACL descriptor: 5 byte(s) long\n\tVersion: 1\n\tByte Ordering: 2\n\tNumber of sub-ACLs: 0\n");
    EXPECT_EQ(dump(bytes{0x84, 1, 2, 0, 0}).err, "The ACL provided is not valid!\n\n");
    EXPECT_EQ(dump(bytes{0x85, 1}).err, "The ACL provided is not valid!\n\n");
    captured none = capture([] {
        sec__dump_acl(nullptr);
        sec_buffer_desc empty{0, nullptr};
        sec__dump_acl(&empty);
    });
    EXPECT_EQ(none.err + none.out, "");
}

TEST(AclDump, UnreadableSubaclReportsOnStdoutAndTheDumpGoesOn) {
    // An anyother sub-ACL counting two entries, then a group sub-ACL.
    bytes b = {0x85, 1, 2, 2, 0, 24, 0, 0, 0, 2, 2, 0, 0, 0, 0, 1, 1, 0, 0, 0, 0, 0, 1, 2, 0, 0, 0, 0, 0,
               17, 0, 0, 0, 16, 1, 0, 0, 0, 0, 1, 0, 0, 0, 0, 4, 0, 'g', 'r', 'p', 0};
    b[29] = static_cast<unsigned char>(b.size() - 29);
    captured c = dump(b);
    EXPECT_EQ(c.err,
              "ACL descriptor: 50 byte(s) long\n\tVersion: 1\n\tByte Ordering: 2\n\tNumber of sub-ACLs: 2\n"
              "\tSubacl:\n\t(length = 24 byte(s); type = 2; mech = ; ACLE count = 2)\n\n"
              "\tSubacl:\n\t(length = 21 byte(s); type = 16; mech = ; ACLE count = 1)\n\n"
              "\t\ttype = g; id = grp; permission = \n");
    EXPECT_EQ(c.out.rfind("4471-111 Failure: The access control list (ACL) buffer/file\n", 0), 0u);
    EXPECT_EQ(c.out.find("4471-111", 1), std::string::npos);
    EXPECT_EQ(rytest::error_code(), 0);

    // Cut off at every length: what is there is shown, the cut is reported
    // on stdout, nothing is read past the block.
    for (size_t n = 5; n < kExample.size(); ++n) {
        captured t = dump(bytes(kExample.begin(), kExample.begin() + static_cast<long>(n)));
        EXPECT_EQ(t.err.rfind("ACL descriptor: " + std::to_string(n) + " byte(s) long\n", 0), 0u);
        EXPECT_NE(t.out.find("4471-110"), std::string::npos) << n;
    }
    // A length field of 0 does not make the walk show one sub-ACL forever.
    bytes z = kExample;
    z[5] = 0;
    captured t = dump(z);
    EXPECT_EQ(t.err.find("Subacl:"), t.err.rfind("Subacl:"));
}

TEST(AclDump, EntryLines) {
    sec_acle_desc u{};
    u.type = SEC_ACLE_TYPE_USER;
    u.perm = 0xb;
    std::strcpy(u.mech, "unix");
    u.id = const_cast<char *>("alice@node1");
    EXPECT_EQ(capture([&] { sec__dump_acle(&u, nullptr, ""); }).err,
              "type = u; mech = unix; id = alice@node1; permission = rwx\n");
    sec_acle_desc g{};
    g.type = SEC_ACLE_TYPE_GROUP;
    g.id = const_cast<char *>("staff");
    EXPECT_EQ(capture([&] { sec__dump_acle(&g, nullptr, "\t"); }).err, "\ttype = g; id = staff; permission = \n");
    sec_acle_desc n{};
    n.type = SEC_ACLE_TYPE_UNAUTHENTICATED;
    n.perm = 0x2001;  // a bit no default template describes
    captured c = capture([&] { sec__dump_acle(&n, nullptr, ""); });
    EXPECT_EQ(c.err.rfind("4471-178 Failure: One of the bits in the ACLE's bit-mask permission", 0), 0u);
    EXPECT_NE(c.err.find("0x00002000"), std::string::npos);
    EXPECT_EQ(rytest::error_code(), 0);

    // A template set of the caller's spells the permission.
    sec_perm_desc mine[] = {{0x1, 'R', "read", "read"}, {0x2000, 'Z', "zap", "zap"}};
    sec_perm_set_desc set{2, mine};
    EXPECT_EQ(capture([&] { sec__dump_acle(&n, &set, ""); }).err, "type = n; permission = RZ\n");
}

}  // namespace
