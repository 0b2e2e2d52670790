#pragma once

#include <string>

#include "Timeline.h"

// The application, as scripts see it.
class MediaHost : public Korvel::Scripted<SharedObject> {
    KORVEL_SCRIPTED(MediaHost)
public:
    MediaHost() { SetScriptClass(); }

    // What the network is told of it, a table. On the UI thread, once there are scripts.
    Korvel::ScriptVal GetPingInfo() const;

private:
    std::string m_Title = "Untitled";
    Korvel::ptr<Timeline> m_Timeline{new Timeline};
};
