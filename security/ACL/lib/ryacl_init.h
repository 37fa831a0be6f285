// The library state: identity handler registry under one mutex.
#pragma once

#include <pthread.h>

#include <cstdint>

#include "ryacl.h"

struct acl__id_handler_s {
    uint32_t type;
    char mech[17];
    sec_acl_id_handler handler;
};

// Run acl__state_init once per process.
void acl__state_ensure_init();

// First handler registered for type and mech (case-insensitive), or null.
int32_t sec__get_id_handler(uint32_t type, const char *mech, sec_acl_id_handler *handler);
