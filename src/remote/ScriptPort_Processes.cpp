// The processes that a host starts: the script server, and those in which scripts run by
// themselves.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "Platform/Files.h"
#include "Platform/Processes.h"
#include "Platform/ProcessesInternal.h"
#include "core/ScriptValInternal.h"
#include "diag/Debug.h"
#include "diag/Env.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptPortInternal.h"

namespace Korvel {
namespace {

constexpr char kToolName[] = "oxscript";

EnvString s_Tool("KORVEL_Tool", true, "");
KorvelScript::Lock& s_ToolLock = *new KorvelScript::Lock;  // for reading it

// Scripts' processes that have not been waited for. Guarded by g_ProcLock.
std::vector<unsigned long long>& s_Children = *new std::vector<unsigned long long>;

// The path of a program, without links and dots; empty when it cannot be executed.
std::string FindProgram(const std::string& path) {
    char found[Platform::kMaxPath];
    struct stat status;
    bool isProgram = realpath(path.c_str(), found) && stat(found, &status) == 0 &&
                     S_ISREG(status.st_mode) && access(found, X_OK) == 0;
    return isProgram ? found : "";
}

std::string FindInPath() {
    OxStringT<char> path;
    Platform::GetEnv("PATH", path);
    std::string rest = static_cast<const char*>(path);
    while (!rest.empty()) {
        size_t end = std::min(rest.find(':'), rest.size());
        // A folder that depends on where the host is could hold anything.
        std::string found =
            rest[0] == '/' ? FindProgram(rest.substr(0, end) + "/" + kToolName) : "";
        if (!found.empty()) return found;
        rest.erase(0, end + 1);
    }
    return "";
}

// Waits for the processes that have ended, once nothing waits for them any more: their ids may be
// given to others then. What was kept for those that have not asked for it goes to `left`.
void ReapChildrenLocked(std::vector<ScriptVal>& left) {
    std::erase_if(s_Children, [&left](unsigned long long id) {
        if (Platform::IsChildRunning(id)) return false;
        left.push_back(TakeProcessDataLocked(id));
        Platform::ReapChild(id);
        return true;
    });
}

}  // namespace

std::string FindTool() {
    OxStringT<char> setting;
    {
        KorvelScript::AutoLock guard(s_ToolLock);
        s_Tool.Get(setting);
    }
    std::string found;
    if (!setting.IsEmpty()) {
        found = FindProgram(static_cast<const char*>(setting));
    } else {
        char library[Platform::kMaxPath] = "";
        Platform::GetSystemFolder(Platform::SF_Library, library, sizeof(library));
        // In a build, and where lib may have a folder for the processor's kind in it.
        for (const char* folder : {"", "../bin/", "../../bin/"}) {
            if (!*library) break;
            found = FindProgram(std::string(library).append(folder).append(kToolName));
            if (!found.empty()) return found;
        }
        found = FindInPath();
    }
    if (found.empty()) {
        g_ScriptServerLog.PrintF(
            "There is no %s: neither beside the library, nor in bin, nor in PATH.\n",
            setting.IsEmpty() ? kToolName : static_cast<const char*>(setting));
    }
    return found;
}

bool StartServer(TagList*) {
    std::string tool = FindTool();
    if (tool.empty()) return false;
    std::string folder = tool.substr(0, tool.rfind('/') + 1);
    g_ScriptServerLog.PrintF("StartServer oxscript -s in %s\n", folder.c_str());
    if (Platform::StartDetached(tool.c_str(), "-s", folder.c_str())) return true;
    g_ScriptServerLog.PrintF("The script server cannot be started.\n");
    return false;
}

bool StartScriptProcess(const char* language, const char* file, const ScriptVal& data) {
    std::string tool = FindTool();
    std::string path = file ? file : "";
    unsigned int port = GetListenPort();
    if (tool.empty() || path.empty()) return false;
    if (!port) {
        g_ScriptServerLog.PrintF("No script in a process of its own could call this one.\n");
        return false;
    }
    char current[Platform::kMaxPath];
    if (path[0] != '/') {  // the process begins elsewhere
        if (!getcwd(current, sizeof(current))) return false;
        path = std::string(current).append("/").append(path);
    }
    if ((tool + path).find('"') != std::string::npos) {
        g_ScriptServerLog.PrintF("A name with a double quote cannot be passed on: %s\n",
                                 path.c_str());
        return false;
    }
    OxStringT<char> command;
    command.PrintF("\"%s\" -q -l %s -a %d \"%s\"", tool.c_str(), language, static_cast<int>(port),
                   path.c_str());
    char folder[Platform::kMaxPath];
    if (!Platform::GetSystemFolder(Platform::SF_Library, folder, sizeof(folder))) return false;
    ScriptVal kept = data;
    kept.Ensure(SV_Table);        // what the process is told goes in there
    std::vector<ScriptVal> left;  // values are foreign code: they go when the lock has been let go
    // The process finds its data however quickly it comes back.
    KorvelScript::AutoLock guard(g_ProcLock);
    ReapChildrenLocked(left);
    unsigned long long id;
    Platform::_Process* process = Platform::NewProcess(command, folder, 0, &id);
    if (!process) return false;
    g_ProcIDs.Ensure(SV_Table);
    g_ProcIDs[id] = kept;
    s_Children.push_back(id);
    Platform::DeleteProcess(process);
    return true;
}

void ReapChildren() {
    std::vector<ScriptVal> left;
    KorvelScript::AutoLock guard(g_ProcLock);
    ReapChildrenLocked(left);
}

ScriptVal TakeProcessDataLocked(const ScriptVal& id) {
    TableEntry* chain = g_ProcIDs.TakeTable();
    TableEntry** link = &chain;
    while (*link && (*link)->m_Key != id) link = &(*link)->m_Next;
    TableEntry* entry = *link;
    if (entry) *link = std::exchange(entry->m_Next, nullptr);
    g_ProcIDs.SetTable(chain);
    ScriptVal data = entry ? std::move(entry->m_Value) : ScriptVal();
    ReleaseChain(entry);
    return data;
}

}  // namespace Korvel
