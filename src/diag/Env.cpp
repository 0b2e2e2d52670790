#include "diag/Env.h"

#include <climits>
#include <cstdlib>

#include "Platform/LocaleInternal.h"
#include "Platform/Processes.h"

namespace Korvel {
namespace {

constexpr char kPrefix[] = "KORVEL_";
constexpr int kNewestVersion = 18;
constexpr int kOldestVersion = 16;

// Asks the host, then the environment from the newest numbered name to the plain one.
bool FindSetting(const char* rest, OxStringT<char>& value) {
    if (EnvCallback callback = g_EnvCallback.load(std::memory_order_acquire)) {
        if (callback(rest, value)) return true;
    }
    OxStringT<char> name;
    for (int version = kNewestVersion; version >= kOldestVersion; version--) {
        name.PrintF("KORVEL%d_%s", version, rest);
        if (Platform::GetEnv(name, value)) return true;
    }
    name.PrintF("KORVEL_%s", rest);
    return Platform::GetEnv(name, value);
}

}  // namespace

constinit std::atomic<int32_t> g_EnvLoadIteration{1};
constinit std::atomic<EnvCallback> g_EnvCallback{nullptr};
EnvBool g_DeveloperMode("KORVEL_Developer_Mode", true, false);

EnvVar::EnvVar(const char* name, bool reload)
    : m_Name(name), m_IsSet(false), m_Reload(reload), m_LoadIteration(0) {}

bool EnvVar::IsSet() {
    LoadIfDue();
    return m_IsSet.load(std::memory_order_relaxed);
}

void EnvVar::InvalidateEnv() {
    g_EnvLoadIteration.fetch_add(1, std::memory_order_acq_rel);
}

void EnvVar::SetEnvCallback(EnvCallback callback) {
    g_EnvCallback.store(callback, std::memory_order_release);
    InvalidateEnv();
}

bool EnvVar::Load(OxStringT<char>& value) {
    const char* name = m_Name;
    bool found = m_Name.BeginsWith(kPrefix) ? FindSetting(name + (sizeof(kPrefix) - 1), value)
                                            : Platform::GetEnv(m_Name, value);
    if (!found) value.Empty();
    m_IsSet.store(found, std::memory_order_relaxed);
    return found;
}

// The iteration is the one from before the search, so that a change that comes meanwhile is not
// taken for seen, and it is stored after the value, so that no other thread takes the default for
// the value.
void EnvVar::LoadNow(int32_t iteration) {
    DoLoad();
    m_LoadIteration.store(m_Reload ? iteration : INT_MAX, std::memory_order_release);
}

void EnvBool::DoLoad() {
    OxStringT<char> text;
    if (!Load(text)) return;
    bool value = false;
    for (const char* yes : {"true", "yes", "on", "1"}) value |= text.CompareNoCase(yes) == 0;
    m_Value.store(value, std::memory_order_relaxed);
}

void EnvInt::DoLoad() {
    OxStringT<char> text;
    if (Load(text)) m_Value.store(strtol(text, nullptr, 10), std::memory_order_relaxed);
}

void EnvFloat::DoLoad() {
    OxStringT<char> text;
    if (Load(text))
        m_Value.store(strtod_l(text, nullptr, Platform::CLocale()), std::memory_order_relaxed);
}

bool EnvString::Get(OxStringT<char>& value) {
    if (!IsSet() || !static_cast<const char*>(m_Value)) return false;
    value = m_Value;
    return true;
}

void EnvString::DoLoad() {
    OxStringT<char> text;
    if (Load(text)) m_Value = text;
}

}  // namespace Korvel
