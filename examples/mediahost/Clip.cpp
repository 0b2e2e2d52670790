#include "Clip.h"

#include <cmath>

#include "Timeline.h"

using namespace Korvel;

static constexpr char kBadLength[] = "A clip takes more than 0 seconds, and at most a day.";

Clip::Clip(const char* name, double length)
    : m_Name(name), m_Length(length), m_Brightness(64 + m_Name.size() * 16 % 128) {
    SetScriptClass();
}

void Clip::Draw(double seconds, unsigned char (&pixels)[kFrameBytes]) const {
    for (int y = 0; y < kHeight; y++) {
        for (int x = 0; x < kWidth; x++) {
            double wave = sin(x * 0.2 + seconds * 3) * cos(y * 0.3 - seconds);
            pixels[y * kWidth + x] = static_cast<unsigned char>(m_Brightness + 60 * wave);
        }
    }
}

KORVEL_PUBLISH(Clip, "Clip", "A piece of a film.",
               "A clip has a name and a length. It can be put on a timeline.")

// Makes a clip. It is found under the name of the class, as app:Clip("Intro", 5), and the clip
// lives as long as the script or a timeline holds it.
KORVEL_CREATE(Clip, 0, {SYMT_ShortHelp, "Makes a clip."}) {
    double length = args[2].ToNumber(1);
    if (!Clip::IsLength(length)) {
        args.SetError(SCERR_InvalidArgs, kBadLength);
        return;
    }
    ptr<Clip> clip(new Clip(args[1].ToString("Untitled"), length));
    args.ReturnObject(clip.Get());
}

// One body reads and writes. Under its attribute name it is part of clip:GetAttrs() and SetAttrs().
KORVEL_VARIABLE(Clip, Name, SSF_Read | SSF_Write, {SYMT_AttrName, "name"},
                {SYMT_ShortHelp, "The name, for people."}) {
    if (set) {
        self.m_Name = args[1].ToString("Untitled");
    } else {
        args.ReturnString(self.m_Name.c_str());
    }
}

// A variable may refuse what it is given.
KORVEL_VARIABLE(Clip, Length, SSF_Read | SSF_Write, {SYMT_AttrName, "length"},
                {SYMT_ShortHelp, "How long it plays, in seconds."}) {
    if (!set) {
        args.ReturnNumber(self.m_Length);
    } else if (double length = args[1].ToNumber(); Clip::IsLength(length)) {
        self.m_Length = length;
    } else {
        args.SetError(SCERR_InvalidArgs, kBadLength);
    }
}

// Without SSF_Write it is never called to write. What depends on others is computed when it is
// asked for.
KORVEL_VARIABLE(Clip, Start, SSF_Read, {SYMT_AttrName, "start"},
                {SYMT_ShortHelp, "Where it begins on its timeline, in seconds; nil on none."}) {
    if (self.m_Timeline) args.ReturnNumber(self.m_Timeline->GetStart(&self));
}

// A block of bytes. SSF_AnyThread: Draw need not wait for the UI thread.
KORVEL_FUNCTION(Clip, GetFrame, SSF_AnyThread, {SYMT_ShortHelp, "Draws a picture."},
                {SYMT_Usage, "The picture at a time, as 64 by 36 bytes from black to white."},
                {SYMT_ReturnType, "MemBlock"}, {SYMT_ReturnName, "pixels"}, {SYMT_Optional, true},
                {SYMT_ArgType, "number"}, {SYMT_ArgName, "seconds"}, {SYMT_CodeLanguage, "lua"},
                {SYMT_Code, "local pixels = clip:GetFrame(2.5)\nprint(pixels.Size, pixels[1])"}) {
    double seconds = args[1].ToNumber(0);
    if (!std::isfinite(seconds)) seconds = 0;
    unsigned char pixels[Clip::kFrameBytes];
    self.Draw(seconds, pixels);
    args.ReturnMemBlock(MemBlock(pixels, sizeof(pixels)));
}

KORVEL_PUBLISHED(Clip);
