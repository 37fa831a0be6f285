// Readable dump of compiled ACLs, sub-ACLs, trees and entries, one numbered
// message (82 to 87) per line, on standard error.
#pragma once

#include "ryacl.h"
#include "ryacl_acl_tree.h"

void sec__dump_acl(sec_acl_buffer_t acl);
void sec__dump_subacl(const unsigned char *subacl, size_t avail, const char *leadspace);
void sec__dump_acltree(sec_acltree_t tree, const char *leadspace);
void sec__dump_acle(const sec_acle_desc *acle, sec_perm_set_t ptplset, const char *leadspace);
