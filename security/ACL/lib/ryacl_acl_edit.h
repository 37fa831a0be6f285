// Editing compiled ACLs (internal part).
#pragma once

#include <atomic>
#include <cstdint>

#include "ryacl.h"

// The common body of sec_add_acle_to_acl (noupdate 0: a duplicate takes the
// new permission) and sec_add_acle_to_acl2 (noupdate 1: refused).
int32_t sec__add_acle_to_acl(sec_boolean_t noupdate, sec_acle_t acle, sec_acl_buffer_t acl);

// Test seam: false sends every edit down the tree road, so tests can hold
// the direct byte-level edit of sorted sub-ACLs against it.  Atomic, so a
// test that flips it while another thread edits races on nothing; an edit
// already under way keeps the road it took.
extern std::atomic<bool> acl__edit_direct_enabled;
