/* The installed headers compile on their own, as strict C99 here. */
#include <ryacl.h>
#include <ry_zo.h>

int main(void) { return ACL_RC_OK; }
