// The library state and the identity handler registry.
#include "ryacl_init.h"

#include <cstring>
#include <new>

#include "ry_zo_int.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

acl__state_desc acl__state;
pthread_once_t acl__init_once_block = PTHREAD_ONCE_INIT;

namespace {

// A block of registration slots.  The header keeps the previous block
// reachable: readers that loaded the old pointer may still be walking it.
struct handler_block {
    const handler_block *prev;
    int32_t capacity;
    acl__id_handler_s *slots() { return reinterpret_cast<acl__id_handler_s *>(this + 1); }
};
static_assert(sizeof(handler_block) % alignof(acl__id_handler_s) == 0,
              "slots must be aligned after the header");

handler_block *block_of(acl__id_handler_s *slots) {
    return slots ? reinterpret_cast<handler_block *>(slots) - 1 : nullptr;
}

}  // namespace

extern "C" void acl__state_init(void) {
    pthread_mutex_init(&acl__state.mutex, nullptr);
    acl__state.count.store(0, std::memory_order_relaxed);
    acl__state.id_handlers.store(nullptr, std::memory_order_relaxed);
    acl__state.capacity = 0;
}

namespace {
// Set once acl__state_init has run, so later calls cost one load.
std::atomic<bool> state_ready{false};
}  // namespace

void acl__state_ensure_init() {
    if (state_ready.load(std::memory_order_acquire)) return;
    pthread_once(&acl__init_once_block, acl__state_init);
    state_ready.store(true, std::memory_order_release);
}

int32_t sec__register_id_handler(uint32_t type, const char *mech, sec_acl_id_handler handler) {
    acl::trace::api_entry(74, 76,
                          {acl::trace::val(type), acl::trace::str(mech), acl::trace::val(handler)});
    acl::clear_error();
    acl__state_ensure_init();

    int32_t rc = 0;
    size_t mlen = 0;
    if (type != SEC_ID_HANDLER_EXPANDED && type != SEC_ID_HANDLER_USER)
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "acl__register_id_handler", 1, type);
    else if (!mech)
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "acl__register_id_handler", 2, 0);
    else if (!handler)
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "acl__register_id_handler", 3, 0);
    else if ((mlen = strnlen(mech, 17)) == 0 || mlen > 16)
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_MECH);
    if (rc) {
        acl::trace::api_exit(77, 78, rc);
        return rc;
    }

    int lrc = pthread_mutex_lock(&acl__state.mutex);
    if (lrc) {
        rc = acl::set_error(ACL_RC_INTERNAL, acl::msg::LOCK_FAILURE, ACL_LOC_ACL, lrc);
        acl::trace::api_exit(77, 78, rc);
        return rc;
    }

    int32_t count = acl__state.count.load(std::memory_order_relaxed);
    acl__id_handler_s *slots = acl__state.id_handlers.load(std::memory_order_relaxed);
    if (count == INT32_MAX) {
        // The count is a signed 32-bit value; nothing else bounds it.
        rc = acl__no_memory("acl__register_id_handler", INT32_MAX);
    } else if (count == acl__state.capacity) {
        // Double the block so a run of registrations costs linear time and
        // memory; the new block is complete before it is published.
        int32_t cap = count == 0 ? 1 : (count > INT32_MAX / 2 ? INT32_MAX : count * 2);
        size_t bytes = sizeof(handler_block) + static_cast<size_t>(cap) * sizeof(acl__id_handler_s);
        void *mem = acl__malloc(bytes);
        if (!mem) {
            rc = acl__no_memory("acl__register_id_handler", bytes);
        } else {
            handler_block *blk = new (mem) handler_block{block_of(slots), cap};
            acl__id_handler_s *fresh = blk->slots();
            if (count) std::memcpy(fresh, slots, static_cast<size_t>(count) * sizeof *fresh);
            acl__state.capacity = cap;
            slots = fresh;
        }
    }
    if (!rc) {
        acl__id_handler_s *slot = &slots[count];
        std::memset(slot, 0, sizeof *slot);
        slot->type = type;
        std::memcpy(slot->mech, mech, mlen);
        slot->handler = handler;
        // Pointer first, then the count: a reader that sees the new count
        // also sees a block holding that many slots.
        acl__state.id_handlers.store(slots, std::memory_order_release);
        acl__state.count.store(count + 1, std::memory_order_release);
    }

    int urc = pthread_mutex_unlock(&acl__state.mutex);
    if (urc) rc = acl::set_error(ACL_RC_INTERNAL, acl::msg::LOCK_FAILURE, ACL_LOC_ACL, urc);
    acl::trace::api_exit(77, 78, rc);
    return rc;
}

int32_t sec__get_id_handler(uint32_t type, const char *mech, sec_acl_id_handler *handler) {
    *handler = nullptr;
    int32_t n = acl__state.count.load(std::memory_order_acquire);
    if (n == 0 || !mech) return 0;
    const acl__id_handler_s *slots = acl__state.id_handlers.load(std::memory_order_acquire);
    for (int32_t i = 0; i < n; ++i) {
        if (slots[i].type == type && zo_strcasecmp_posix_1(slots[i].mech, mech) == 0) {
            *handler = slots[i].handler;
            break;
        }
    }
    return 0;
}
