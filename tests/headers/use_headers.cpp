// The installed headers must compile as C++ on their own: the C client again.
#include "use_headers.c"
