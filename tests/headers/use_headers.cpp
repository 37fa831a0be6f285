/* The installed headers must compile as C++ on their own. */
#include <ryacl.h>
#include <ry_zo.h>

int main(void) {
    sec_acle_desc e = {0, {0}, SEC_ACLE_TYPE_ANYOTHER, 0};
    sec_buffer_desc b = {0, 0};
    zo_error_t *rec = 0;
    (void)e;
    (void)b;
    zo_get_error_1(&rec);
    zo_rel_error_1(rec);
    return ACL_RC_OK;
}
