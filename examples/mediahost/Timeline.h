#pragma once

#include <atomic>
#include <thread>
#include <vector>

#include "Clip.h"

// Clips, one after the other, each on one timeline and once. Scripts get a clip by its number or
// its name: timeline[1], timeline["Intro"].
class Timeline : public Korvel::Scripted<SharedObject> {
    KORVEL_SCRIPTED(Timeline)
public:
    static constexpr int kFramesPerSecond = 25;
    static constexpr size_t kMostClips = 900;  // of a day each, so that an int counts the pictures

    Timeline() { SetScriptClass(); }
    ~Timeline() override;

    // How much of the render under way is done, from 0 to 1. On any thread.
    double GetProgress() const { return m_Progress; }
    void Clear();

    // Where a clip begins, in seconds; for null, where the last one ends.
    double GetStart(const Clip* clip) const;

private:
    // The place of a clip in the list, behind the last one when there is none.
    size_t Find(const Korvel::ScriptVal& numberOrName) const;
    void StartRender(Korvel::ScriptArgs* reply);
    void EndRender();

    std::vector<Korvel::ptr<Clip>> m_Clips;
    std::thread m_Renderer;
    std::atomic<bool> m_IsRendering{false};
    std::atomic<bool> m_MustStop{false};
    std::atomic<double> m_Progress{0};
};
