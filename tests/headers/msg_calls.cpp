// Calls of the typed recording API that must or must not compile; the
// headers tests build it once per CASE.
#include "ryacl_error.h"

int32_t call() {
#if CASE == 0  // right number and kinds, a skipped position (113) included
    acl::set_error(6, acl::msg::NO_MEMORY, "call", 12u);
    acl::set_error(43, acl::msg::ACLE_ID_UNEXPECTED, "file", __LINE__);
    return acl::set_error(4, acl::msg::BAD_PARAM, "call", 3, static_cast<const void *>(nullptr));
#elif CASE == 1  // one argument short
    return acl::set_error(6, acl::msg::NO_MEMORY, "call");
#elif CASE == 2  // one argument too many
    return acl::set_error(42, acl::msg::BAD_ACL, 1);
#elif CASE == 3  // a number where the text wants a text
    return acl::set_error(6, acl::msg::NO_MEMORY, 12, "call");
#elif CASE == 4  // a text where the text wants a number
    return acl::set_error(4, acl::msg::BAD_PARAM, "call", "3", nullptr);
#endif
}
