#pragma once

#include <string>

#include "SharedObject.h"
#include "objects/Publish.h"

class Timeline;

// A piece of a film. Scripts make some with app:Clip(name, length).
class Clip : public Korvel::Scripted<SharedObject> {
    KORVEL_SCRIPTED(Clip)
public:
    static constexpr int kWidth = 64, kHeight = 36, kFrameBytes = kWidth * kHeight;

    static constexpr double kMostSeconds = 86400;

    Clip(const char* name, double length);

    static bool IsLength(double seconds) { return seconds > 0 && seconds <= kMostSeconds; }

    const std::string& GetName() const { return m_Name; }
    double GetLength() const { return m_Length; }

    // The timeline that it is on, which says so itself; null when it is on none.
    Timeline* GetTimeline() const { return m_Timeline; }
    void SetTimeline(Timeline* timeline) { m_Timeline = timeline; }

    // Draws the picture at a time of this clip. On any thread: it uses only what never changes.
    void Draw(double seconds, unsigned char (&pixels)[kFrameBytes]) const;

private:
    std::string m_Name;
    double m_Length = 0;  // in seconds
    Timeline* m_Timeline = nullptr;
    const int m_Brightness;
};
