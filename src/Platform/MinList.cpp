#include "Platform/MinList.h"

namespace Korvel::KorvelScript {

MinNode::~MinNode() = default;

MinList::MinList() {
    m_Head.m_Next = &m_Tail;
    m_Tail.m_Prev = &m_Head;
}

MinList::~MinList() = default;

void MinList::Add(MinNode* node) {
    node->m_Prev = m_Tail.m_Prev;
    node->m_Next = &m_Tail;
    m_Tail.m_Prev->m_Next = node;
    m_Tail.m_Prev = node;
}

void MinList::Remove(MinNode* node) {
    node->m_Prev->m_Next = node->m_Next;
    node->m_Next->m_Prev = node->m_Prev;
    node->m_Prev = node->m_Next = nullptr;
}

MinNode* MinList::Next(const MinNode* node) const {
    MinNode* next = node ? node->m_Next : m_Head.m_Next;
    return next->m_Next ? next : nullptr;  // only the tail sentinel has no next
}

MinNode* MinList::Prev(const MinNode* node) const {
    MinNode* prev = node ? node->m_Prev : m_Tail.m_Prev;
    return prev->m_Prev ? prev : nullptr;
}

void MinList::Clear(bool deleteNodes) {
    while (MinNode* node = Next(nullptr)) {
        Remove(node);
        if (deleteNodes) delete node;
    }
}

bool MinList::IsEmpty() const {
    return m_Head.m_Next == &m_Tail;
}

}  // namespace Korvel::KorvelScript
