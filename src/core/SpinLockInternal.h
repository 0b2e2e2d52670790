#pragma once

#include <cassert>
#include <cstdint>

#include "Platform/NoKillInternal.h"
#include "core/SpinLock.h"

namespace Korvel {

// The locks around the tables of objects and symbols, in the order in which a thread may take them.
enum class LockRank : uint8_t {
    None,
    Connection,  // a connection's own; it nests
    Exports,     // the process's table of exported objects
    Last,        // taken with none of these held
};

// A lock's place in that order, from before the lock is taken until the end of the scope. Debug
// builds assert the order.
class LockPlace {
public:
#ifdef NDEBUG
    explicit LockPlace(LockRank) {}
    ~LockPlace() {}  // not trivial, or it would be an unused variable
    static void AssertMoreMayCome() {}
#else
    explicit LockPlace(LockRank rank) : m_Before(t_Rank) {
        assert((rank > t_Rank || (rank == LockRank::Connection && rank == t_Rank)) &&
               "locks are taken in the order of LockRank");
        assert((rank != LockRank::Last || t_Rank == LockRank::None) && "this lock is taken alone");
        t_Rank = rank;
    }
    ~LockPlace() {
        t_Rank = m_Before;
    }

    // For locks without a place: none is taken with a spin lock of the tables held.
    static void AssertMoreMayCome() {
        assert(t_Rank < LockRank::Exports && "nothing is taken with this lock held");
    }
#endif
    LockPlace(const LockPlace&) = delete;
    LockPlace& operator=(const LockPlace&) = delete;

#ifndef NDEBUG
private:
    static inline constinit thread_local LockRank t_Rank = LockRank::None;

    LockRank m_Before;
#endif
};

// Holds a spin lock with a place in the order, until the end of its scope. The holder cannot be
// killed meanwhile.
class AutoPlacedLock {
public:
    AutoPlacedLock(LockRank rank, SpinLock& lock) : m_Place(rank), m_Lock(lock) {}

private:
    Platform::NoKill m_NoKill;
    LockPlace m_Place;
    AutoSpinLock m_Lock;
};

}  // namespace Korvel
