// The dump: which text goes to which stream, with which empty lines.
#include <gtest/gtest.h>

#include "lib_acl_bytes.h"
#include "ryacl_acl_dump.h"
#include "ryacl_error.h"

namespace {

using namespace libtest;
using captured = std::pair<std::string, std::string>;  // stderr, stdout

template <class F>
captured capture(F &&f) {
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    f();
    const std::string err = testing::internal::GetCapturedStderr();
    return {err, testing::internal::GetCapturedStdout()};
}

// The dump of an exact-size heap copy, so that ASan sees any read past it.
captured dump(const bytes &b) {
    sec_buffer_desc d = own(b);
    const captured c = capture([&] { sec__dump_acl(&d); });
    drop(d);
    return c;
}

TEST(AclDump, WorkedExampleByteForByte) {
    acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);  // pending before: cleared by the dump
    EXPECT_EQ(dump(worked_example()),
              captured("ACL descriptor: 61 byte(s) long\n\tVersion: 1\n\tByte Ordering: 2\n\tNumber of sub-ACLs: 2\n"
                       "\tSubacl:\n\t(length = 39 byte(s); type = 4; mech = unix; ACLE count = 2)\n\n"
                       "\t\ttype = u; mech = unix; id = Alice; permission = rw\n"
                       "\t\ttype = u; mech = unix; id = bob; permission = r\n"
                       "\tSubacl:\n\t(length = 17 byte(s); type = 2; mech = ; ACLE count = 1)\n\n"
                       "\t\ttype = o; permission = r\n",
                       ""));
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_EQ(dump({0x85, 1, 2, 0, 0}).first,
              "ACL descriptor: 5 byte(s) long\n\tVersion: 1\n\tByte Ordering: 2\n\tNumber of sub-ACLs: 0\n");
    for (const bytes &b : {bytes{0x84, 1, 2, 0, 0}, bytes{0x85, 1}})
        EXPECT_EQ(dump(b), captured("The ACL provided is not valid!\n\n", ""));
    EXPECT_EQ(dump({}), captured());
    EXPECT_EQ(capture([] { sec__dump_acl(nullptr); }), captured());
}

TEST(AclDump, UnreadableSubaclsAreReportedOnStdout) {
    // Cut off at every length: what is there is shown, the cut reported.
    const bytes full = worked_example();
    for (size_t n = 5; n < full.size(); ++n) {
        const captured t = dump(bytes(full.begin(), full.begin() + long(n)));
        EXPECT_EQ(t.first.rfind("ACL descriptor: " + std::to_string(n) + " byte(s) long\n", 0), 0u);
        EXPECT_NE(t.second.find("4471-110"), std::string::npos) << n;
    }
    // Handed over alone, a sub-ACL one byte short of its header shows only the cut.
    const bytes nine(full.begin() + 5, full.begin() + 14);
    const captured alone = capture([&] { sec__dump_subacl(nine.data(), nine.size(), "\t"); });
    EXPECT_EQ(alone.first, "");
    EXPECT_NE(alone.second.find("4471-110"), std::string::npos) << alone.second;
    // A count that lies: reported, and the next sub-ACL still shown.
    bytes b = full;
    b[13] = 0x7f;
    const captured c = dump(b);
    EXPECT_EQ(c.second.rfind("4471-127 Failure: ", 0), 0u) << c.second;
    EXPECT_EQ(c.first.substr(c.first.size() - 44), "ACLE count = 1)\n\n\t\ttype = o; permission = r\n");
    // A length field of 0 does not make the walk show one sub-ACL forever.
    b = full;
    b[5] = 0;
    const std::string err = dump(b).first;
    EXPECT_EQ(err.find("Subacl:"), err.rfind("Subacl:"));
}

}  // namespace
