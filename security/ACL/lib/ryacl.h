/*
 * ryacl.h - the ACL library: entries, compiled ACLs, editing, evaluation.
 *
 * Every operation that returns an int32_t returns 0 on success and otherwise
 * a return code (ACL_RC_*) after recording an error in the calling thread's
 * error slot (see ry_zo.h: zo_get_error_1, zo_get_errmsg_1).  Results handed
 * to the caller are heap blocks: release them with the matching release
 * operation, or with free() for texts.
 *
 * Plain C99; usable from C and C++.  All operations may be called from
 * several threads; a compiled ACL or an entry list must not be used by two
 * threads while one of them edits or fills it.
 */
#ifndef RYACL_H
#define RYACL_H

#include <stdint.h>

#include "ry_zo.h" /* also defines RYACL_API, the export marker */

#ifdef __cplusplus
extern "C" {
#endif

#define RYACL_VERSION "1.0.0"

/* Return codes. */
#define ACL_RC_OK 0
#define ACL_RC_INFO 1
#define ACL_RC_BAD_ARGS 4
#define ACL_RC_NO_MEMORY 6
#define ACL_RC_UNKNOWN_USER 15
#define ACL_RC_NO_MATCH 18
#define ACL_RC_INTERNAL 23
#define ACL_RC_CODESET 26
#define ACL_RC_PERMISSION 36
#define ACL_RC_FILE_ERROR 37
#define ACL_RC_BAD_ACL 42
#define ACL_RC_BAD_ACLE 43
#define ACL_RC_NOT_IMPLEMENTED 99
#define ACL_RC_BAD_FILE_NAME 105

/* Entry types: one bit each. */
#define SEC_ACLE_TYPE_UNAUTHENTICATED 1
#define SEC_ACLE_TYPE_ANYOTHER 2
#define SEC_ACLE_TYPE_USER 4
#define SEC_ACLE_TYPE_EXPANDED 8
#define SEC_ACLE_TYPE_GROUP 16

/* Flag of sec__single_acle_perm's type: match user entries through the
 * identity handler registered for SEC_ID_HANDLER_USER. */
#define SEC_ACLE_USE_ID_HANDLER 0x80

/* Flags of sec_read_acl_file. */
#define SEC_ACLF_FROM_TEXT 0x1
#define SEC_ACLF_WRITE_CACHE 0x2
#define SEC_ACLF_CONVERT_CACHE 0x4

/* Registry types of identity handlers. */
#define SEC_ID_HANDLER_EXPANDED 1
#define SEC_ID_HANDLER_USER 2

typedef uint32_t sec_boolean_t;

/* One ACL entry.  mech holds at most 16 characters; id is absent (null) for
 * the unauthenticated and anyother types. */
typedef struct sec_acle_s {
    uint32_t perm;
    char mech[17];
    unsigned char type;
    char *id;
} sec_acle_desc, *sec_acle_t;

/* A list of entries, filled by the listing operations. */
typedef struct sec_acle_list_s {
    int32_t count;
    sec_acle_t *acles;
} sec_acle_list_desc, *sec_acle_list_t;

/* One permission template: the bit, its letter, its names. */
typedef struct sec_perm_s {
    uint32_t code;
    char printchar;
    char printstring[14];
    char printhelp[64];
} sec_perm_desc, *sec_perm_t;

/* A set of templates; a null set means the default set of 13 templates. */
typedef struct sec_perm_set_s {
    int32_t count;
    sec_perm_t perms;
} sec_perm_set_desc, *sec_perm_set_t;

/* A compiled ACL: length bytes at value, one heap block owned by the holder.
 * length 0 and value null hold no ACL. */
typedef struct sec_buffer_s {
    int32_t length;
    void *value;
} sec_buffer_desc, sec_acl_buffer_desc, *sec_buffer_t, *sec_acl_buffer_t;

/* Identity handler: 0 when client_id and entry_id denote the same identity,
 * negative when client_id orders before entry_id, positive otherwise. */
typedef int32_t (*sec_acl_id_handler)(const char *client_id, const char *entry_id);

/* ---- Entries and permissions ------------------------------------------ */

/* Create an entry of `type` granting `perm`.  mech (user, expanded) and id
 * (user, expanded, group) are in the caller's codeset and stored in UTF-8.
 * Release *acle with sec_release_acle. */
RYACL_API int32_t sec_create_acle(unsigned char type, uint32_t perm, const char *mech,
                                  const char *id, sec_acle_t *acle);

/* Release an entry and its identity; null is ignored. */
RYACL_API void sec_release_acle(sec_acle_t acle);

/* Copies of the entry's mechanism and identity in the caller's codeset
 * (null where the type has none); release both with free(). */
RYACL_API int32_t sec_display_acle_id(sec_acle_t acle, char **mech, char **id);

/* Permission letters to a bit mask; null permset selects the default set. */
RYACL_API int32_t sec_translate_perms(const char *perms, sec_perm_set_t permset,
                                      uint32_t *bitmask);

/* Bit mask to permission letters in `perms`, an area of at least 33 bytes. */
RYACL_API int32_t sec_translate_bitmask(uint32_t bitmask, sec_perm_set_t permset, char *perms);

/* ---- Compiled ACLs ----------------------------------------------------- */

/* Read an ACL file into a compiled ACL, from its current cache file
 * (NAME.cacl) when allowed, else from the text.  flags: SEC_ACLF_*.  The
 * flags in effect at the end are stored in *rflags when rflags is given. */
RYACL_API int32_t sec_read_acl_file(const char *filename, const char *username,
                                    sec_perm_set_t permtmpl, uint32_t flags, sec_buffer_t acl,
                                    uint32_t *rflags);

/* Copy `length` caller bytes into a new compiled ACL (not validated). */
RYACL_API int32_t sec_read_acl_from_data(int32_t length, const unsigned char *buffer,
                                         sec_acl_buffer_t acl);

/* Fill acl with the 5-byte empty compiled ACL. */
RYACL_API int32_t sec_create_empty_acl(sec_acl_buffer_t acl);

/* Convert a compiled ACL to host byte order in place; with verify, validate
 * one that already is. */
RYACL_API int32_t sec_convert_acl_to_host(sec_boolean_t verify, sec_acl_buffer_t acl);

/* Free a compiled ACL and empty its descriptor.  A block that is not a
 * compiled ACL is not freed: ACL_RC_BAD_ACL, and the block stays the
 * caller's, its descriptor unchanged. */
RYACL_API int32_t sec_release_acl(sec_acl_buffer_t acl);

/* ---- Editing and listing ----------------------------------------------- */

/* Add an entry; an entry of the same identity has its permission replaced. */
RYACL_API int32_t sec_add_acle_to_acl(sec_acle_t acle, sec_acl_buffer_t acl);

/* Add an entry; an entry of the same identity already present is refused. */
RYACL_API int32_t sec_add_acle_to_acl2(sec_acle_t acle, sec_acl_buffer_t acl);

/* Delete the entry of the same identity as acle. */
RYACL_API int32_t sec_del_acle_from_acl(sec_acle_t acle, sec_acl_buffer_t acl);

/* Fill aclelist with every entry of the ACL; release with
 * sec_release_aclelist. */
RYACL_API int32_t sec_list_acl(sec_acl_buffer_t acl, sec_acle_list_t aclelist);

/* Fill aclelist with the entries of one type (and, for user and expanded
 * entries, one mechanism, or every mechanism when mech is null). */
RYACL_API int32_t sec_list_acl_by_type(sec_acl_buffer_t acl, unsigned char type,
                                       const char *mech, sec_acle_list_t aclelist);

/* Release every entry of a list and empty it. */
RYACL_API void sec_release_aclelist(sec_acle_list_t aclelist);

/* ---- For security services only ------------------------------------------ */

/* The operations below (sec__*, acl__*) are meant for the security services
 * that guard resources with ACLs, not for general applications: they
 * evaluate what an ACL grants and change process-wide state (the identity
 * handler registry, the trace registration).  They are as stable as the
 * rest of this interface; an application that only reads, edits and lists
 * ACLs needs none of them. */

/* Register an identity handler for a registry type (SEC_ID_HANDLER_*) and a
 * mechanism of 1 to 16 characters.  Registrations are never removed. */
RYACL_API int32_t sec__register_id_handler(uint32_t type, const char *mech,
                                           sec_acl_id_handler handler);

/* Permission the ACL grants through one entry kind: type is
 * SEC_ACLE_TYPE_UNAUTHENTICATED, _ANYOTHER, _USER or _EXPANDED, optionally
 * with SEC_ACLE_USE_ID_HANDLER.  zmech, when given, selects the sub-ACL in
 * place of mech. */
RYACL_API int32_t sec__single_acle_perm(sec_acl_buffer_t acl, unsigned char type,
                                        const char *mech, const char *zmech, const char *id,
                                        uint32_t *perm);

/* OR of the permissions of every group entry named in groups[0..count). */
RYACL_API int32_t sec__group_acles_perm(sec_acl_buffer_t acl, int32_t count, sec_buffer_t groups,
                                        uint32_t *perm);

/* End the library's registration with the trace facility (a security
 * service's shutdown step). */
RYACL_API int32_t acl__trace_unregister_component(void);

/* ---- Indexed evaluation --------------------------------------------------- */

/* A compiled ACL prepared for evaluation by hash lookup: for a service that
 * evaluates one ACL for many requests.  Opaque; made by sec_create_acl_index,
 * never changed afterwards (any number of threads may evaluate through one
 * index at once), released with sec_release_acl_index. */
typedef struct sec_acl_index_s *sec_acl_index_t;

/* Validate a host-order compiled ACL (the codes and messages of
 * sec_convert_acl_to_host with verify; a buffer in the other byte order is
 * refused with ACL_RC_BAD_ACL, message 102) and build its index in *index.
 * The index keeps a copy: the caller may change or release the buffer
 * afterwards.  On failure *index is null. */
RYACL_API int32_t sec_create_acl_index(sec_acl_buffer_t acl, sec_acl_index_t *index);

/* sec__single_acle_perm on the buffer the index was made from: the same
 * code, mask and recorded error, and the same identity handler calls in the
 * same order (handlers are looked up at each call, so registrations made
 * after the index count).  A user lookup without a handler, hit or miss,
 * costs one hash probe whatever the size of the sub-ACL. */
RYACL_API int32_t sec_index_single_acle_perm(sec_acl_index_t index, unsigned char type,
                                             const char *mech, const char *zmech, const char *id,
                                             uint32_t *perm);

/* sec__group_acles_perm on the buffer the index was made from; one hash
 * probe per group name. */
RYACL_API int32_t sec_index_group_acles_perm(sec_acl_index_t index, int32_t count,
                                             sec_buffer_t groups, uint32_t *perm);

/* Release an index; null is ignored.  Touches no error record. */
RYACL_API void sec_release_acl_index(sec_acl_index_t index);

#ifdef __cplusplus
}
#endif

#endif /* RYACL_H */
