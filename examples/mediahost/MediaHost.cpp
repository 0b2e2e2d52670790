#include "MediaHost.h"

#include <unistd.h>

#include <csignal>

#include "core/OxString.h"

using namespace Korvel;

ScriptVal MediaHost::GetPingInfo() const {
    ScriptVal info(SV_Table, nullptr);
    info["Title"] = m_Title.c_str();
    info["Progress"] = m_Timeline->GetProgress();
    return info;
}

KORVEL_PUBLISH(
    MediaHost, "MediaHost", "A small media application.",
    "It has one timeline. Start at app.Timeline, and app:GetHelp() tells the rest. The constant "
    "app.FramesPerSecond is how many pictures a second has.")

KORVEL_VARIABLE(MediaHost, Title, SSF_Read | SSF_Write, {SYMT_AttrName, "title"},
                {SYMT_ShortHelp, "The title of the film."}) {
    if (set) {
        self.m_Title = args[1].ToString("Untitled");
    } else {
        args.ReturnString(self.m_Title.c_str());
    }
}

KORVEL_VARIABLE(MediaHost, Timeline, SSF_Read, {SYMT_ShortHelp, "What is played."}) {
    args.ReturnObject(self.m_Timeline.Get());
}

// SSF_DelayGet: whoever asks in a loop gets an answer each half second, and costs no more.
KORVEL_VARIABLE(MediaHost, Progress, SSF_Read | SSF_AnyThread | SSF_DelayGet,
                {SYMT_ShortHelp, "How much has been rendered, from 0 to 1."},
                {SYMT_SeeAlso, "Timeline:Render"}) {
    args.ReturnNumber(self.m_Timeline->GetProgress());
}

// The script server asks for it every few seconds, and gives it to whoever pings the host.
KORVEL_FUNCTION(MediaHost, GetPingInfo, 0, {SYMT_ShortHelp, "What others may see of this host."}) {
    args.Return(self.GetPingInfo());
}

// A constant belongs to all objects of the host. Lists of members leave constants out, so the help
// of the class tells of it.
KORVEL_CONSTANT(MediaHost, FramesPerSecond, SSF_AnyThread,
                {SYMT_ShortHelp, "How many pictures a second has."}) {
    args.ReturnNumber(Timeline::kFramesPerSecond);
}

KORVEL_FUNCTION(MediaHost, Quit, 0, {SYMT_ShortHelp, "Ends the application."}) {
    kill(getpid(), SIGTERM);
}

// The help does not mention it, but a script that knows its name can call it.
KORVEL_FUNCTION(MediaHost, Reset, SSF_Hidden, {SYMT_ShortHelp, "Begins a new film."}) {
    self.m_Timeline->Clear();
    self.m_Title = "Untitled";
}

// Is there in debug mode only, that is with --debug.
KORVEL_FUNCTION(MediaHost, CountUses, SSF_Debug, {SYMT_ShortHelp, "Who holds the timeline?"}) {
    ScriptVal info(SV_Table, nullptr);
    self.m_Timeline->GetObjectInfo("UseCount", info);
    args.Return(info);
}

KORVEL_HELP(MediaHost, Rendering, {SYMT_ShortHelp, "How to render a film."},
            {SYMT_Body,
             "Timeline:Render answers when all is drawn. Other scripts can watch "
             "MediaHost.Progress meanwhile."},
            {SYMT_CodeLanguage, "lua"}, {SYMT_CodeLabel, "Render and wait"},
            {SYMT_Code, "local frames = app.Timeline:Render()\nprint(frames .. \" pictures\")"});

KORVEL_PUBLISHED(MediaHost);
