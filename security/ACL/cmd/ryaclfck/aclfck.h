// ryaclfck: the checker's option flags and its check of one ACL file.
#pragma once

#include <cstdint>

#include "ryacl_acl_file.h"

#define ACLFCK_CACHE 0x01u     // -s: compile and store NAME.cacl
#define ACLFCK_CONTINUE 0x02u  // -c: go past faulty lines and duplicates
#define ACLFCK_VERBOSE 0x04u   // -v: print every entry before adding it
#define ACLFCK_STREAM 0x08u    // -S: not implemented; cleared before the check
#define ACLFCK_HELP 0x10u      // -h: only to catch a repeated -h

// The run control behind main(): reads the options, settles them, runs the
// check and returns the exit status.  The locale is the caller's business.
int aclfck__main(int argc, char **argv);

// Check one ACL file: vet, read, parse every entry into the trees and, with
// ACLFCK_CACHE and no error, store the compiled ACL.  Every failure it meets
// is printed on standard error; returns 0 or the code that ended the check.
int32_t aclfck__bulk_aclfile(const char *aclfname, const char *username, uint32_t flags);

// The check with what it meets sent to `sink` instead of printed: each
// fault with its line, and every failure or notice about the file as a whole
// (unreadable, empty under -v, not cached, ...) with line 0; with
// ACLFCK_VERBOSE each entry before it is added.  `res`, when given, receives
// the count of entries and whether the text was clean.  Returns what
// aclfck__bulk_aclfile returns.
int32_t aclfck__check(const char *aclfname, const char *username, uint32_t flags, acl__text_sink &sink,
                      acl__parse_result *res = nullptr);

// Resolve aclfname (and username's home directory) into name, an area of
// ACL_FNAME_AREA bytes, and vet the file it names: a regular file and, with
// a user, owned by that user and writable by nobody else.
int32_t aclfck__get_aclfile(const char *aclfname, const char *username, char *name);

// Entry point kept for a stream mode (-S); it does nothing and returns 0.
int32_t aclfck__stream_aclfile(const char *aclfname, const char *username, uint32_t flags);
