#pragma once

#include "core/Export.h"

namespace Korvel::KorvelScript {

class MinList;

// The links of a thing that can stand on a list. Both are null while it is on none. The destructor
// does not unlink: owners remove a node before they destroy it.
class KORVEL_EXPORT MinNode {
public:
    MinNode() = default;
    MinNode(const MinNode&) = delete;
    MinNode& operator=(const MinNode&) = delete;
    virtual ~MinNode();

private:
    friend class MinList;

    MinNode* m_Prev = nullptr;
    MinNode* m_Next = nullptr;
};

// A doubly linked list of nodes that carry their own links, so that no operation allocates and each
// takes constant time.
//
// Invariant: m_Head and m_Tail are sentinels; only they have exactly one null link.
// Ownership: borrows its nodes; only Clear(true) deletes them.
// Threads:   one at a time. EventQueue shows how a list is shared.
class KORVEL_EXPORT MinList {
public:
    MinList();
    MinList(const MinList&) = delete;
    MinList& operator=(const MinList&) = delete;
    virtual ~MinList();  // leaves the nodes alone

    void Add(MinNode* node);     // at the end; the node must be on no list
    void Remove(MinNode* node);  // from whichever list holds it; it must be on one

    // The node after or before `node`; for null the first or the last one. Null past the end.
    MinNode* Next(const MinNode* node) const;
    MinNode* Prev(const MinNode* node) const;

    // Takes all nodes off, first to last, and deletes each on the way if asked. The destructors of
    // the nodes must leave the list alone.
    void Clear(bool deleteNodes);

    bool IsEmpty() const;

private:
    MinNode m_Head;
    MinNode m_Tail;
};

// The same for nodes of one class, which derives from MinNode. While a loop runs over the list, its
// present node may not be removed.
template <class T>
class MinListT : public MinList {
public:
    class Iterator {
    public:
        Iterator(const MinListT* list, T* node) : m_List(list), m_Node(node) {}
        T* operator*() const { return m_Node; }
        Iterator& operator++() {
            m_Node = m_List->Next(m_Node);
            return *this;
        }
        bool operator==(const Iterator& other) const = default;

    private:
        const MinListT* m_List;
        T* m_Node;
    };

    void Add(T* node) { MinList::Add(node); }
    void Remove(T* node) { MinList::Remove(node); }
    T* Next(const T* node) const { return static_cast<T*>(MinList::Next(node)); }
    T* Prev(const T* node) const { return static_cast<T*>(MinList::Prev(node)); }

    void operator+=(T* node) { Add(node); }
    void operator-=(T* node) { Remove(node); }

    Iterator begin() const { return {this, Next(nullptr)}; }
    Iterator end() const { return {this, nullptr}; }
};

}  // namespace Korvel::KorvelScript
