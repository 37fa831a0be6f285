// ryaclfck: the checker's option flags and its check of one ACL file.
#pragma once

#include <sys/stat.h>

#include <cstdint>

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

// Resolve aclfname (and username's home directory) into name, an area of
// ACL_FNAME_AREA bytes, and vet the file it names: a regular file and, with
// a user, owned by that user and writable by nobody else.  When vetted is
// given it receives the file's status, so the caller can tell whether what
// it opens later is still the file that was vetted.
int32_t aclfck__get_aclfile(const char *aclfname, const char *username, char *name,
                            struct stat *vetted = nullptr);

// Entry point kept for a stream mode (-S); it does nothing and returns 0.
int32_t aclfck__stream_aclfile(const char *aclfname, const char *username, uint32_t flags);
