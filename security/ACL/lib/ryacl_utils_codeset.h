// The two conversion handles behind acl__convert_to_utf8/from_utf8 and
// their once-controls.
#pragma once

#include <pthread.h>

#include "ry_zo_int.h"

extern "C" {
extern zo_iconv_t acl__to_utf8_hdl;
extern zo_iconv_t acl__from_utf8_hdl;
extern pthread_once_t acl__init_to_utf8_once_block;
extern pthread_once_t acl__init_from_utf8_once_block;
}

// Open one handle; run only through its once-control.
void acl__init_to_utf8_handle(void);
void acl__init_from_utf8_handle(void);

// Test seam: open the handle of one direction for `codeset` instead of the
// locale's (or UTF-8's).  Takes effect only before that direction's first
// conversion; the text must outlive it.  Not exported from the shared
// library.
void acl__set_codeset_for_test(bool from_utf8, const char *codeset);
