#pragma once

#include "Platform/Event.h"
#include "Platform/Lock.h"
#include "Platform/MinList.h"
#include "core/0ReusePool.h"

namespace Korvel::KorvelScript {

// A message. Its creator owns it until Put, the queue until Get, and then the taker until Reply,
// which is how a message ends.
class KORVEL_EXPORT QueueNode : public MinNode, public Reuser {
public:
    explicit QueueNode(unsigned int type) : m_Type(type) {}

    // Ends the taker's ownership: deletes the message. A subclass may hand it back to its sender
    // instead. This form, called by its full name, accepts a null message.
    virtual void Reply();

    unsigned int GetType() const { return m_Type; }  // the meaning is the queue's user's

private:
    const unsigned int m_Type;
};

// Messages from any number of threads to a taker, first in, first out.
//
// The event does not count: several messages may leave a single signal. A taker therefore waits and
// then gets until there is nothing more.
//
// Ownership: the destructor leaves nodes that are still queued alone.
// Threads:   Put, Get and Wait from any thread. The lock is held for the list operation and for the
//            signal, never during a wait, and inside of Put and Get a thread cannot be killed.
// Failure:   a queue that finds no memory for its lock guards nothing, and one without an event
//            (GetEvent is null) never lets a waiter through.
class KORVEL_EXPORT EventQueue : public MinListT<QueueNode>, public Lock, public Event {
public:
    // Takes over the node and signals. Null is ignored. False when the queue has been closed: the
    // node is then still the caller's.
    bool Put(QueueNode* node);

    // The oldest node, the caller's until Reply; null when there is none. It does not wait.
    QueueNode* Get();

    // From here on Put takes nothing more. What is queued can still be got.
    void Close();

private:
    bool m_IsClosed = false;  // guarded by the lock
};

}  // namespace Korvel::KorvelScript
