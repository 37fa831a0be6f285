// Codeset conversion between the local codeset and UTF-8 through two
// handles opened once per process (one per direction).
#pragma once

#include <cstddef>
#include <cstdint>

// Convert a NUL-terminated text; *local_length / *utf8_length count the NUL.
// The result is a new heap text the caller frees.  0, or 6, 23, 26 with the
// error recorded.
int32_t acl__convert_to_utf8(const char *local_string, size_t *local_length, char **utf8_string,
                             size_t *utf8_length);
int32_t acl__convert_from_utf8(const char *utf8_string, size_t *utf8_length, char **local_string,
                               size_t *local_length);
