#include "Platform/EventQueue.h"

#include "Platform/NoKillInternal.h"

namespace Korvel::KorvelScript {

void QueueNode::Reply() {
    if (!IsNull(this)) delete this;
}

void EventQueue::Put(QueueNode* node) {
    if (!node) return;
    Platform::NoKill noKill;
    AutoLock guard(*this);
    Add(node);
    Signal();
}

QueueNode* EventQueue::Get() {
    Platform::NoKill noKill;
    AutoLock guard(*this);
    QueueNode* node = Next(nullptr);
    if (node) Remove(node);
    return node;
}

}  // namespace Korvel::KorvelScript
