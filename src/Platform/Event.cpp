#include "Platform/Event.h"

#include "Platform/Events.h"

namespace Korvel::KorvelScript {

Event::Event() : m_Event(Platform::NewEvent(false, false)) {}
Event::~Event() {
    Platform::DeleteEvent(m_Event);
}

void Event::Signal() {
    Platform::SetEvent(m_Event);
}
void Event::Reset() {
    Platform::ResetEvent(m_Event);
}
bool Event::Wait(unsigned int timeoutMs) {
    return Platform::WaitEvent(m_Event, timeoutMs);
}

}  // namespace Korvel::KorvelScript
