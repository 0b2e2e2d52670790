#pragma once

#include <atomic>
#include <cstdint>

#include "core/Export.h"
#include "core/OxString.h"

namespace Korvel {

// The count of changes that settings follow; 1 at first. A setting whose own count is lower reads
// itself anew.
KORVEL_EXPORT extern std::atomic<int32_t> g_EnvLoadIteration;

// The host's source of values, null at first. It gets a setting's name without its "KORVEL_", fills
// in `value` and returns true, or returns false to leave the answer to the environment.
using EnvCallback = bool (*)(const char* name, OxStringT<char>& value);
KORVEL_EXPORT extern std::atomic<EnvCallback> g_EnvCallback;

// A run-time switch that reads itself from the process environment: when it is first asked, and
// again after InvalidateEnv if it was made with `reload`. Make it a static object.
//
// A name that begins with "KORVEL_" is looked up with the callback, then in the environment with a
// version number, newest first ("KORVEL18_", "KORVEL17_", "KORVEL16_"), then as it stands. Any
// other name is looked up in the environment alone. Names match without regard to case.
//
// A setting that has lost its variable keeps its last value, and IsSet becomes false.
//
// Threads: reading needs no lock, but for an EnvString that may be reloading: it wants one of the
//          readers' own. Two threads may load a setting at once; if the environment changes just
//          then, the older value may stand until the next change.
class KORVEL_EXPORT EnvVar {
public:
    EnvVar(const char* name, bool reload);
    EnvVar(const EnvVar&) = delete;
    EnvVar& operator=(const EnvVar&) = delete;

    // True when the last load found a value. Loads if that is due.
    bool IsSet();

    // Declares the environment changed: every setting made with `reload` reads itself anew.
    static void InvalidateEnv();

    // Installs the host's source of values (null removes it), which counts as a change.
    static void SetEnvCallback(EnvCallback callback);

protected:
    ~EnvVar() = default;

    // Reads the setting's text. Returns false, with `value` empty, when there is none.
    bool Load(OxStringT<char>& value);

    // Loads the setting if it has not seen the latest change.
    void LoadIfDue() {
        int32_t iteration = g_EnvLoadIteration.load(std::memory_order_acquire);
        if (m_LoadIteration.load(std::memory_order_acquire) < iteration) [[unlikely]] {
            LoadNow(iteration);
        }
    }

    // Parses the text that Load finds; leaves the value alone when there is none.
    virtual void DoLoad() = 0;

    OxStringT<char> m_Name;
    std::atomic<bool> m_IsSet;
    bool m_Reload;
    std::atomic<int32_t> m_LoadIteration;

private:
    void LoadNow(int32_t iteration);
};

// "true", "yes", "on" and "1", in any case, are true; any other text is false.
class KORVEL_EXPORT EnvBool final : public EnvVar {
public:
    EnvBool(const char* name, bool reload, bool def) : EnvVar(name, reload), m_Value(def) {}
    operator bool() {
        LoadIfDue();
        return m_Value.load(std::memory_order_relaxed);
    }

private:
    void DoLoad() override;
    std::atomic<bool> m_Value;
};

// Decimal digits up to the first other character; a text that has none is 0.
class KORVEL_EXPORT EnvInt final : public EnvVar {
public:
    EnvInt(const char* name, bool reload, int64_t def) : EnvVar(name, reload), m_Value(def) {}
    operator int64_t() {
        LoadIfDue();
        return m_Value.load(std::memory_order_relaxed);
    }

private:
    void DoLoad() override;
    std::atomic<int64_t> m_Value;
};

// As strtod reads it, with a point as the decimal sign whatever the host's locale.
class KORVEL_EXPORT EnvFloat final : public EnvVar {
public:
    EnvFloat(const char* name, bool reload, double def) : EnvVar(name, reload), m_Value(def) {}
    operator double() {
        LoadIfDue();
        return m_Value.load(std::memory_order_relaxed);
    }

private:
    void DoLoad() override;
    std::atomic<double> m_Value;
};

class KORVEL_EXPORT EnvString final : public EnvVar {
public:
    EnvString(const char* name, bool reload, const char* def)
        : EnvVar(name, reload), m_Value(def) {}

    // Copies the text and returns true if the setting is set; otherwise leaves `value` alone.
    bool Get(OxStringT<char>& value);

private:
    void DoLoad() override;
    OxStringT<char> m_Value;
};

// "KORVEL_Developer_Mode", for the host; nothing in the library reads it.
KORVEL_EXPORT extern EnvBool g_DeveloperMode;

}  // namespace Korvel
