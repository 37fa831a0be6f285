// Validation of compiled ACLs that come from outside the library.
#pragma once

#include <cstdint>

#include "ryacl.h"

// Validate the structure of a compiled ACL in host byte order whose bytes 0
// and 1 are 0x85 and 1.  Changes nothing.  0; 42 with message 97, 106 to
// 111; 43 with message 112 to 114 for an entry fault in the last sub-ACL.
// Every read stays within acl->length bytes.
int32_t sec__check_acl_buffer(const sec_acl_buffer_desc *acl);
