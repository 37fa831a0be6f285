// ACL entries, permission templates and the ACL text parser (internal).
#pragma once

#include <cstddef>
#include <cstdint>

#include "ryacl.h"

extern "C" {
// The 13 default templates and the set that points at them.  Both are
// read-only: every caller shares them, so none may change a template.
extern const sec_perm_desc acl__default_perm_list[13];
extern const sec_perm_set_desc acl__default_perm_set;
}

// True for the five entry type codes.
inline bool acl__valid_type(unsigned t) {
    return t == SEC_ACLE_TYPE_UNAUTHENTICATED || t == SEC_ACLE_TYPE_ANYOTHER ||
           t == SEC_ACLE_TYPE_USER || t == SEC_ACLE_TYPE_EXPANDED || t == SEC_ACLE_TYPE_GROUP;
}
inline bool acl__type_has_mech(unsigned t) {
    return t == SEC_ACLE_TYPE_USER || t == SEC_ACLE_TYPE_EXPANDED;
}
inline bool acl__type_has_id(unsigned t) {
    return t == SEC_ACLE_TYPE_USER || t == SEC_ACLE_TYPE_EXPANDED || t == SEC_ACLE_TYPE_GROUP;
}
// Letter of a type in ACL text, dumps and messages: n o u e g ('?' otherwise).
char acl__type_letter(unsigned t);

// Build an entry record; with translate the mechanism and identity are
// converted from the local codeset to UTF-8, else copied as they are.
int32_t sec__create_acle(unsigned char type, uint32_t perm, const char *mech, const char *id,
                         sec_boolean_t translate, sec_acle_t *acle);

// Letters to mask, ORed into *perm (not cleared first).  permset required.
int32_t sec__translate_perms(const char *ps, const sec_perm_set_desc *permset, uint32_t *perm);
// Mask to letters into perm (33 bytes).  permset required.
int32_t sec__translate_bitmask(uint32_t pbm, const sec_perm_set_desc *permset, char *perm);

// Parse one line of ACL text in place.  *tacl is the cursor (null when the
// text is used up), *length the bytes from the cursor to the end with the
// terminating NUL, *lineno the number of the line being parsed.  Returns 0
// at the end of the text, 1 when a line was consumed (acle->type 0 for a
// blank or comment line), or a return code for a faulty line (consumed).
int32_t sec__read_acle_from_text(const sec_perm_set_desc *permset, char **tacl, size_t *length,
                                 int32_t *lineno, sec_acle_t acle);

// A faulty line's report, kept so that a caller that parses ahead can
// record it when it reaches the line.  token points into the text.
struct acl__line_fault {
    int32_t rc = 0;
    int32_t msg = 0;
    int32_t line = 0;
    const char *token = nullptr;
    size_t length = 0;  // the line's bytes with its terminator
};
// What a caller parsing many lines passes in and gets back besides the
// entry: the byte classes acl__line_classes returned on this thread since
// its locale last changed (looked up once, not once per line), and the
// lengths of the entry's mechanism and identifier (0 for none), which the
// parser knows without counting again.
struct acl__line_ctx {
    const unsigned char *classes = nullptr;
    size_t mechlen = 0;
    size_t idlen = 0;
};
// sec__read_acle_from_text that records nothing: a faulty line's report
// goes to *fault and its code is returned.  The thread's error may have
// been changed on the way (a permission letter's message) and is not the
// line's until acl__record_line_fault is called.
int32_t acl__read_acle_deferred(const sec_perm_set_desc *permset, char **tacl, size_t *length, int32_t *lineno,
                                sec_acle_t acle, acl__line_fault *fault, acl__line_ctx *ctx = nullptr);
// The byte classes of the calling thread's locale that the parser uses.
const unsigned char *acl__line_classes();
// Record the report as sec__read_acle_from_text does; returns its code.
int32_t acl__record_line_fault(const acl__line_fault &fault);
