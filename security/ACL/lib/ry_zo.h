/*
 * ry_zo.h - error records and message formatting of the ryacl utility layer.
 *
 * Every failing operation of the ACL library leaves one error record in the
 * calling thread's error slot.  A record names a message of a catalog by
 * number, carries the message's default text and the values for its
 * positional placeholders ("%1$s", "%2$d", "0x%3$x", "%1$c", "0x%1$08x").
 * zo_get_errmsg_1() turns a record into the finished, localised sentence.
 *
 * Plain C99; usable from C and C++.
 */
#ifndef RY_ZO_H
#define RY_ZO_H

#include <stdint.h>

/*
 * RYACL_API marks every operation the shared library exports, in this header
 * and in ryacl.h alike: default visibility while the library itself is built
 * (everything else in it is hidden), a plain declaration for its clients.
 */
#ifndef RYACL_API
#if defined(RYACL_BUILDING)
#define RYACL_API __attribute__((visibility("default")))
#else
#define RYACL_API
#endif
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* Kind of one argument value. */
typedef enum zo_error_arg_type_e {
    ZO_ERROR_ARG_INT = 0,
    ZO_ERROR_ARG_LONG = 1,
    ZO_ERROR_ARG_LONG_LONG = 2,
    ZO_ERROR_ARG_DOUBLE = 3,
    /* A position the message text skips: it has no value. */
    ZO_ERROR_ARG_RESERVED = 4,
    ZO_ERROR_ARG_CHAR_STR = 5,
    ZO_ERROR_ARG_VOID_PTR = 6
} zo_error_arg_type_t;

typedef union zo_error_arg_value_u {
    int zo_arg_int;
    long zo_arg_long;
    long long zo_arg_long_long;
    double zo_arg_double;
    char *zo_arg_char_str;
    void *zo_arg_void_ptr;
} zo_error_arg_value_t;

/* One argument of a record. */
typedef struct zo_error_arg_s {
    zo_error_arg_type_t zo_arg_type;
    zo_error_arg_value_t zo_arg_value;
} zo_error_arg_t;

/*
 * One error record.  zo_args[i] holds the value of placeholder position
 * i + 1; zo_arg_cnt is the highest position the default text uses.
 */
typedef struct zo_error_s {
    int32_t zo_error_id;     /* the return code */
    char *zo_ffdc_id;        /* first-failure data id; always null here */
    char *zo_msg_cat;        /* catalog file name, e.g. "ryseclib.cat" */
    int32_t zo_msg_set;      /* message set, 1 */
    int32_t zo_msg_num;      /* message number */
    char *zo_msg_default;    /* default text, a positional format */
    uint32_t zo_arg_cnt;     /* number of argument records */
    zo_error_arg_t *zo_args; /* the argument records */
} zo_error_t;

/*
 * Make a new record the calling thread's current error.  The trailing
 * arguments are read in the number and kinds that the positional
 * placeholders of msg_default state, in ascending order of position: a
 * `const char *` for "s", an `int` for "d", "x", "08x" and "c".  Texts are
 * copied.  Returns 0.
 */
RYACL_API int zo_set_error_1(int error_id, const char *ffdc_id, const char *msg_cat, int msg_set,
                             int msg_num, const char *msg_default, ...);

/*
 * The same with the values given as an array of argc records, one per
 * placeholder position that msg_default uses, in ascending order.  Values
 * missing from the array format as nothing; extra ones are ignored.
 */
RYACL_API int zo_set_error_argv_1(int error_id, const char *ffdc_id, const char *msg_cat,
                                  int msg_set, int msg_num, const char *msg_default,
                                  unsigned argc, const zo_error_arg_t *argv);

/* Clear the calling thread's current error. */
RYACL_API int zo_set_no_error_1(void);

/*
 * Give the caller its own copy of the current error (release it with
 * zo_rel_error_1), or a null pointer when the slot holds no error.
 * Returns 0, or 6 when the copy cannot be allocated: *record is then a
 * record of the calling thread that refers to the slot itself, valid until
 * the thread's next error operation, so that an out-of-memory failure can
 * still be reported.
 */
RYACL_API int zo_get_error_1(zo_error_t **record);

/* Make a copy obtained earlier the current error again; null clears it. */
RYACL_API int zo_pset_error_1(const zo_error_t *record);

/*
 * Format a record: the catalog's text for the record's set and number in the
 * current locale, or the default text when the catalog lacks it, with every
 * placeholder replaced.  Control characters in the arguments (0x00 to 0x1f
 * but tab, and 0x7f) are written as \xNN.  The text is released with
 * zo_rel_errmsg_1.  Returns 0, 4 for a null record or text pointer, 6 when
 * the text cannot be allocated: *text is then the default text formatted
 * into an area of the calling thread (at most 8 KiB), valid until its next
 * zo_get_errmsg_1.
 */
RYACL_API int zo_get_errmsg_1(const zo_error_t *record, char **text);

RYACL_API void zo_rel_error_1(zo_error_t *record);
RYACL_API void zo_rel_errmsg_1(char *text);

#ifdef __cplusplus
}
#endif

#endif /* RY_ZO_H */
