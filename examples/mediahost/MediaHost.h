#pragma once

#include <string>

#include "Timeline.h"

// The application, as scripts see it.
class MediaHost : public Korvel::Scripted<SharedObject> {
    KORVEL_SCRIPTED(MediaHost)
public:
    MediaHost() { SetScriptClass(); }

private:
    std::string m_Title = "Untitled";
    Korvel::ptr<Timeline> m_Timeline{new Timeline};
};
