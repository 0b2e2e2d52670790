#include "Platform/EventQueue.h"

#include "Platform/EventsInternal.h"
#include "Platform/FutexInternal.h"
#include "Platform/NoKillInternal.h"

namespace Korvel::KorvelScript {

void QueueNode::Reply() {
    if (!IsNull(this)) delete this;
}

bool EventQueue::Put(QueueNode* node) {
    if (!node) return true;
    Platform::NoKill noKill;
    const void* sleeper;
    {
        AutoLock guard(*this);
        if (m_IsClosed) return false;
        Add(node);
        sleeper = Platform::SetEventQuietly(GetEvent());
    }
    // From here on the taker may have deleted the queue.
    if (sleeper) Platform::FutexWake(sleeper, 1);
    return true;
}

void EventQueue::Close() {
    Platform::NoKill noKill;
    AutoLock guard(*this);
    m_IsClosed = true;
}

QueueNode* EventQueue::Get() {
    Platform::NoKill noKill;
    AutoLock guard(*this);
    QueueNode* node = Next(nullptr);
    if (node) Remove(node);
    return node;
}

}  // namespace Korvel::KorvelScript
