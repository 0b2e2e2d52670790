#pragma once

#include <atomic>
#include <string>
#include <vector>

#include "runtime/Script.h"
#include "runtime/ScriptLanguage.h"
#include "tools/oxscript/Application.h"

namespace Korvel::Oxscript {

// A script state of the tool's own, which runs one text or file after the other while the tool
// waits.
//
// An interactive one keeps the compiler off, so that Ctrl-C (SIGINT) can stop what runs at any
// instruction. Where that does not help for 2 seconds, a second one ends the state by force, and a
// fresh one takes its place. Otherwise SIGINT ends the tool.
//
// Threads: the tool's main thread, which may not receive SIGINT while there is a Runner: the signal
//          goes to the state's thread, the only one that may touch the interpreter.
// Errors:  of scripts go to standard error with the prefix in front, if any, and the traceback
//          behind. There is at most one Runner at a time.
class Runner {
public:
    // `args` is the script and its arguments; `app` becomes the globals `app` and `startup`.
    Runner(KorvelScript::ScriptLanguage* language, std::vector<std::string> args,
           const Application& app, const char* prefix, bool isInteractive);
    Runner(const Runner&) = delete;
    Runner& operator=(const Runner&) = delete;
    ~Runner();

    // False when there was no memory for a state. It can't run anything then.
    bool IsReady() const { return m_State != nullptr; }

    // Runs to the end; false when the script has failed, or called os.exit. No text or name may
    // begin with byte 0xFF.
    bool RunFile(const std::string& file);
    bool RunText(const std::string& text, const char* name);

    // The exit status that the last run asks for: what it has returned or given to os.exit.
    bool HasExited() const { return m_HasExited; }
    int GetStatus() const { return m_Status; }

    // What a text prints; nothing when it fails, which goes without a message. The application has
    // a second for each answer.
    std::string Ask(const std::string& text);

private:
    static void OnError(void* self, const char* text);
    static void OnAnswer(void* answer, const char* text);

    void Start();
    void SetArgs();
    void StartAfresh();
    bool Run(KorvelScript::eScriptMessage type, const std::string& what, const char* name);
    void ShowError(const char* text);
    void ShowPendingErrors();
    void TellIfApplicationHasGone();
    bool IsExit(const char* text);
    int TakeStatus(unsigned int result);

    KorvelScript::ScriptLanguage* const m_Language;
    std::vector<std::string> m_Args;
    const Application m_App;
    const char* const m_Prefix;
    const bool m_IsInteractive;
    KorvelScript::ScriptState* m_State = nullptr;  // owned
    int m_Status = 0;
    bool m_HasToldOfEnd = false;  // of the application

    // State's thread while something runs, else main thread
    bool m_HasExited = false;
    bool m_IsLineStart = true;  // of standard error
};

}  // namespace Korvel::Oxscript
