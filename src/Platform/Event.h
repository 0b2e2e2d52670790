#pragma once

#include "core/Export.h"

namespace Korvel::Platform {
struct _Event;
}

namespace Korvel::KorvelScript {

// An auto-reset event as an object; see Platform/Events.h for what signals and waits do. It starts
// clear.
//
// Failure: without the memory for its event GetEvent is null and every wait is false at once.
class KORVEL_EXPORT Event {
public:
    Event();
    Event(const Event&) = delete;
    Event& operator=(const Event&) = delete;
    virtual ~Event();  // nobody may wait for it

    void Signal();
    void Reset();

    // True when it was signalled. Milliseconds; 0 only looks, 0xFFFFFFFF has no limit.
    bool Wait(unsigned int timeoutMs);

    Platform::_Event* GetEvent() const { return m_Event; }  // borrowed

private:
    Platform::_Event* m_Event;
};

}  // namespace Korvel::KorvelScript
