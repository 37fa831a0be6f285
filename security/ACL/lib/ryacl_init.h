// The library state: identity handler registry under one mutex.
#pragma once

#include <pthread.h>

#include <atomic>
#include <cstdint>

#include "ryacl.h"

struct acl__id_handler_s {
    uint32_t type;
    char mech[17];
    sec_acl_id_handler handler;
};

// Registrations are only ever appended, so lookups never take the mutex:
// `count` and `id_handlers` are published with release stores after the
// slots they cover are written, and a reader that loads the count first
// always finds at least that many valid slots behind the pointer it loads
// next.  A full block is replaced by a copy twice its size; old blocks are
// never freed (a reader may still walk one) and stay reachable through the
// block header, so the registry costs memory linear in its registrations.
struct acl__state_s {
    pthread_mutex_t mutex;
    std::atomic<int32_t> count;                    // registrations published
    std::atomic<acl__id_handler_s *> id_handlers;  // current block's slots
    int32_t capacity;                              // slots of the current block; under mutex
};
typedef acl__state_s acl__state_desc;

extern acl__state_desc acl__state;
extern pthread_once_t acl__init_once_block;

// Zero the state and initialise its mutex; run once through
// acl__init_once_block.
extern "C" void acl__state_init(void);

// Run acl__state_init once per process.
void acl__state_ensure_init();

// First handler registered for type and mech (case-insensitive), or null.
// Takes no lock; always 0.
int32_t sec__get_id_handler(uint32_t type, const char *mech, sec_acl_id_handler *handler);

// The handler an evaluation of an entry of `acletype` consults: the
// mechanism's expanded handler (without one no expanded identity matches),
// or its user handler when the caller's `type` asks for one.  Shared by the
// walk and the index so both consult the registry alike.
inline sec_acl_id_handler acl__eval_handler(unsigned char acletype, unsigned char type, const char *mech) {
    sec_acl_id_handler handler = nullptr;
    if (acletype == SEC_ACLE_TYPE_EXPANDED)
        sec__get_id_handler(SEC_ID_HANDLER_EXPANDED, mech, &handler);
    else if (type & SEC_ACLE_USE_ID_HANDLER)
        sec__get_id_handler(SEC_ID_HANDLER_USER, mech, &handler);
    return handler;
}
