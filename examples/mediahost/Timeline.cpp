#include "Timeline.h"

#include <cstddef>
#include <memory>

#include "Platform/Threads.h"
#include "remote/RemoteApp.h"

using namespace Korvel;

Timeline::~Timeline() {
    Clear();
}

void Timeline::EndRender() {
    m_MustStop = true;
    if (m_Renderer.joinable()) m_Renderer.join();
    m_MustStop = false;
}

void Timeline::Clear() {
    EndRender();
    for (const ptr<Clip>& clip : m_Clips) clip->SetTimeline(nullptr);
    m_Clips.clear();
}

// No number with a fraction equals a place.
size_t Timeline::Find(const ScriptVal& key) const {
    size_t place = 0;
    for (const ptr<Clip>& clip : m_Clips) {
        if (key == place + 1 || key == clip->GetName().c_str()) break;
        place++;
    }
    return place;
}

double Timeline::GetStart(const Clip* sought) const {
    double start = 0;
    for (const ptr<Clip>& clip : m_Clips) {
        if (clip.Get() == sought) break;
        start += clip->GetLength();
    }
    return start;
}

// Draws every picture on a thread of its own, and then answers the script, which waits meanwhile.
void Timeline::StartRender(ScriptArgs* reply) {
    struct Part {
        ptr<Clip> m_Clip;
        int m_NumFrames;
    };
    std::vector<Part> parts;
    int total = 0;
    for (const ptr<Clip>& clip : m_Clips) {
        int numFrames = static_cast<int>(clip->GetLength() * kFramesPerSecond);
        parts.push_back({clip, numFrames});
        total += numFrames;
    }
    EndRender();
    m_IsRendering = true;
    m_Progress = 0;
    m_Renderer = std::thread([this, parts, total, reply = std::unique_ptr<ScriptArgs>(reply)] {
        Platform::InitThread();
        // A script that has gone needs no pictures.
        auto isWanted = [&] { return !m_MustStop && reply->GetApp()->Connected(); };
        int drawn = 0;
        double sum = 0;
        for (const Part& part : parts) {
            for (int i = 0; i < part.m_NumFrames && isWanted(); i++) {
                unsigned char pixels[Clip::kFrameBytes];
                part.m_Clip->Draw(static_cast<double>(i) / kFramesPerSecond, pixels);
                for (unsigned char pixel : pixels) sum += pixel;
                m_Progress = static_cast<double>(++drawn) / total;
            }
        }
        if (drawn == total) {
            reply->ReturnNumber(drawn);
            reply->ReturnNumber(drawn ? sum / drawn / Clip::kFrameBytes : 0);
        } else {
            reply->SetError(SCERR_Unknown, "The render has been stopped.");
        }
        m_IsRendering = false;
        reply->SendReply();
    });
}

KORVEL_PUBLISH(Timeline, "Timeline", "Clips, one after the other.",
               "timeline[1] is the first clip, timeline[\"Intro\"] the one of that name.")

// An object as an argument: null where the script gave none, or something of another class.
KORVEL_FUNCTION(Timeline, Add, 0, {SYMT_ShortHelp, "Puts a clip at the end."},
                {SYMT_Usage, "Puts a clip behind the others, and tells how many there are."},
                {SYMT_ReturnType, "number"}, {SYMT_ReturnName, "count"}, {SYMT_ArgType, "Clip"},
                {SYMT_ArgName, "clip"}, {SYMT_CodeLanguage, "lua"},
                {SYMT_Code, "app.Timeline:Add(app:Clip(\"Intro\", 5))"},
                {SYMT_SeeAlso, "Timeline:Remove"}) {
    auto* clip = dynamic_cast<Clip*>(args[1].ToLocalObject());
    if (!clip) {
        args.SetError(SCERR_InvalidArgs, "Add needs a clip.");
        return;
    }
    if (clip->GetTimeline()) {
        args.SetError(SCERR_InvalidArgs, "The clip is on a timeline already.");
        return;
    }
    if (self.m_Clips.size() == Timeline::kMostClips) {
        args.SetError(SCERR_Unknown, "The timeline is full.");
        return;
    }
    self.m_Clips.push_back(ptr<Clip>::Share(clip));
    clip->SetTimeline(&self);
    args.ReturnNumber(static_cast<double>(self.m_Clips.size()));
}

KORVEL_FUNCTION(Timeline, Remove, 0, {SYMT_ShortHelp, "Takes a clip away."},
                {SYMT_Usage, "Takes away the clip of a number or a name, and returns it."},
                {SYMT_ReturnType, "Clip"}, {SYMT_ReturnName, "clip"},
                {SYMT_ArgType, "number or string"}, {SYMT_ArgName, "which"},
                {SYMT_SeeAlso, "Timeline:Add"}) {
    size_t place = self.Find(args[1]);
    if (place == self.m_Clips.size()) {
        args.SetError(SCERR_InvalidArgs, "There is no such clip.");
        return;
    }
    ptr<Clip> clip = self.m_Clips[place];
    self.m_Clips.erase(self.m_Clips.begin() + static_cast<std::ptrdiff_t>(place));
    clip->SetTimeline(nullptr);
    args.ReturnObject(clip.Get());
}

// A table of objects.
KORVEL_FUNCTION(Timeline, GetClips, 0, {SYMT_ShortHelp, "Lists the clips."}) {
    ScriptVal list(SV_Table, nullptr);
    int number = 0;
    for (const ptr<Clip>& clip : self.m_Clips) list[++number] = clip.Get();
    args.Return(list);
}

KORVEL_VARIABLE(Timeline, Duration, SSF_Read, {SYMT_AttrName, "duration"},
                {SYMT_ShortHelp, "How long all clips play, in seconds."}) {
    args.ReturnNumber(self.GetStart(nullptr));
}

// Asked for what no member is called.
KORVEL_OPCODE(Timeline, SST_GetTableUnknown, 0) {
    size_t place = self.Find(args[0]);
    if (place < self.m_Clips.size()) args.ReturnObject(self.m_Clips[place].Get());
}

// Answers later: the UI thread goes on, and so does all else on this connection.
KORVEL_FUNCTION(Timeline, Render, 0, {SYMT_ShortHelp, "Draws all pictures."},
                {SYMT_Usage, "Returns when all is drawn. The host can be used meanwhile."},
                {SYMT_ReturnType, "number"}, {SYMT_ReturnName, "frames"},
                {SYMT_ReturnType, "number"}, {SYMT_ReturnName, "brightness"},
                {SYMT_ReturnDesc, "of all pictures, from 0 to 255"},
                {SYMT_SeeAlso, "MediaHost.Progress"}) {
    if (self.m_IsRendering) {
        args.SetError(SCERR_Unknown, "A render is under way.");
    } else if (ScriptArgs* reply = args.DeferReply()) {
        self.StartRender(reply);
    } else {
        args.SetError(SCERR_Unsupported, "Only a script in another process can wait for this.");
    }
}

KORVEL_PUBLISHED(Timeline);
