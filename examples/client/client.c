/*
 * A small client of the ACL library: reads an ACL file (storing its cache,
 * then again from the cache) and prints what it grants to a user, to an
 * expanded identity through an identity handler, and to a set of groups.
 *
 * usage: ryacl_client ACLFILE MECH USER EXPANDED [GROUP...]
 */
#include <stdio.h>
#include <string.h>

#include <ryacl.h>

/* An expanded identity "team/member" belongs to the entry "team". */
static int32_t team_member(const char *client, const char *entry) {
    size_t n = strlen(entry);
    int c = strncmp(client, entry, n);
    if (c == 0 && client[n] == '/') return 0;
    return c ? c : 1;
}

static void print_error(const char *what) {
    zo_error_t *err = NULL;
    char *text = NULL;
    zo_get_error_1(&err);
    if (err) zo_get_errmsg_1(err, &text);
    fprintf(stderr, "%s: %s", what, text ? text : "(no message)\n");
    zo_rel_errmsg_1(text);
    zo_rel_error_1(err);
}

static void print_perm(const char *what, int32_t rc, uint32_t perm) {
    char letters[33] = "";
    if (rc == 0 && sec_translate_bitmask(perm, NULL, letters) == 0)
        printf("%s: 0x%x %s\n", what, (unsigned)perm, letters);
    else if (rc == ACL_RC_BAD_ACLE)
        printf("%s: none\n", what);
    else
        print_error(what);
}

int main(int argc, char **argv) {
    sec_buffer_desc acl = {0, NULL};
    uint32_t rflags = 0, perm = 0;
    sec_buffer_desc groups[16];
    int32_t rc, i, ngroups = 0;

    if (argc < 5 || argc > 5 + 16) {
        fprintf(stderr, "usage: %s ACLFILE MECH USER EXPANDED [GROUP...]\n", argv[0]);
        return 2;
    }
    rc = sec_read_acl_file(argv[1], NULL, NULL, SEC_ACLF_WRITE_CACHE, &acl, &rflags);
    if (rc) {
        print_error("read");
        return 1;
    }
    printf("compiled: %d bytes, from %s, cache %s\n", (int)acl.length,
           rflags & SEC_ACLF_FROM_TEXT ? "text" : "cache",
           rflags & SEC_ACLF_WRITE_CACHE ? "written" : "not written");
    sec_release_acl(&acl);
    rc = sec_read_acl_file(argv[1], NULL, NULL, SEC_ACLF_CONVERT_CACHE, &acl, &rflags);
    if (rc) {
        print_error("read again");
        return 1;
    }
    printf("again: %d bytes, from %s\n", (int)acl.length,
           rflags & SEC_ACLF_FROM_TEXT ? "text" : "cache");

    if (sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, argv[2], team_member) != 0) {
        print_error("register");
        return 1;
    }
    rc = sec__single_acle_perm(&acl, SEC_ACLE_TYPE_USER, argv[2], NULL, argv[3], &perm);
    print_perm("user", rc, perm);
    rc = sec__single_acle_perm(&acl, SEC_ACLE_TYPE_EXPANDED, argv[2], NULL, argv[4], &perm);
    print_perm("expanded", rc, perm);
    for (i = 5; i < argc; ++i) {
        groups[ngroups].length = 0;
        groups[ngroups].value = argv[i];
        ++ngroups;
    }
    rc = sec__group_acles_perm(&acl, ngroups, groups, &perm);
    print_perm("groups", rc, perm);
    rc = sec__single_acle_perm(&acl, SEC_ACLE_TYPE_ANYOTHER, NULL, NULL, NULL, &perm);
    print_perm("anyother", rc, perm);
    sec_release_acl(&acl);
    return 0;
}
