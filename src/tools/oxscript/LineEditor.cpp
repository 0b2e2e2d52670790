#include "tools/oxscript/LineEditor.h"

#include <langinfo.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace Korvel::Oxscript {
namespace {

constexpr int kHistorySize = 1000;
constexpr char kIndent[] = "    ";

// Makes the folders that a path leads through, for their owner alone.
void MakeFolders(const std::string& path) {
    for (size_t end = path.find('/', 1); end != path.npos; end = path.find('/', end + 1)) {
        mkdir(path.substr(0, end).c_str(), 0700);
    }
}

// Where the history lies, in the user's folder for what programs leave behind; empty without one.
std::string FindHistoryFile() {
    const char* state = getenv("XDG_STATE_HOME");
    const char* home = getenv("HOME");
    std::string folder;
    if (state && *state == '/') {
        folder = state;
    } else if (home && *home == '/') {
        folder = std::string(home) + "/.local/state";
    } else {
        return "";
    }
    return folder + "/oxscript/history";
}

// The editor takes the terminal's bytes for what the locale says, and scripts are UTF-8.
void SetUTF8() {
    setlocale(LC_CTYPE, "");
    if (strcmp(nl_langinfo(CODESET), "UTF-8") != 0) setlocale(LC_CTYPE, "C.UTF-8");
}

size_t CommonLength(const std::string& a, const std::string& b) {
    return static_cast<size_t>(std::mismatch(a.begin(), a.end(), b.begin(), b.end()).first -
                               a.begin());
}

}  // namespace

LineEditor::LineEditor(Completer completer)
    : m_Complete(std::move(completer)),
      m_Out(isatty(STDOUT_FILENO) ? stdout : stderr),
      m_HistoryFile(FindHistoryFile()) {
    SetUTF8();
    m_Edit = el_init("oxscript", stdin, m_Out, stderr);
    m_History = history_init();
    if (m_History) {
        HistEvent event;
        history(m_History, &event, H_SETSIZE, kHistorySize);
        history(m_History, &event, H_SETUNIQUE, 1);
        if (!m_HistoryFile.empty()) {
            MakeFolders(m_HistoryFile);
            history(m_History, &event, H_LOAD, m_HistoryFile.c_str());
        }
    }
    if (!m_Edit) return;
    el_set(m_Edit, EL_CLIENTDATA, this);
    el_set(m_Edit, EL_PROMPT, GetPrompt);
    el_set(m_Edit, EL_SIGNAL, 1);  // follows the window's size, survives being suspended
    el_set(m_Edit, EL_EDITOR, "emacs");
    if (m_History) el_set(m_Edit, EL_HIST, history, m_History);
    // The narrow form of this copies the texts, and never frees them.
    el_wset(m_Edit, EL_ADDFN, L"oxscript-drop", L"Drop the line", OnDrop);
    el_wset(m_Edit, EL_ADDFN, L"oxscript-suspend", L"Suspend the tool", OnSuspend);
    el_wset(m_Edit, EL_ADDFN, L"oxscript-complete", L"Complete a name", OnComplete);
    el_set(m_Edit, EL_BIND, "^R", "em-inc-search-prev", nullptr);
    el_source(m_Edit, nullptr);                        // the user's own settings
    el_set(m_Edit, EL_SETTY, "-d", "-isig", nullptr);  // such keys are keys while a line is edited
    el_set(m_Edit, EL_BIND, "^C", "oxscript-drop", nullptr);
    el_set(m_Edit, EL_BIND, "^Z", "oxscript-suspend", nullptr);
    el_set(m_Edit, EL_BIND, "^I", "oxscript-complete", nullptr);
}

LineEditor::~LineEditor() {
    if (m_Edit) el_end(m_Edit);
    if (m_History) history_end(m_History);
}

LineEditor::Line LineEditor::Read(const char* prompt, std::string& line) {
    if (!m_Edit) return Line::End;
    m_Prompt = prompt;
    m_IsDropped = false;
    // The editor does this itself, but only when the prompt stands there: keys would be lost.
    el_set(m_Edit, EL_PREP_TERM, 1);
    int count = 0;
    const char* text = el_gets(m_Edit, &count);
    if (m_IsDropped || !text || count <= 0) {
        fputc('\n', m_Out);
        return m_IsDropped ? Line::Dropped : Line::End;
    }
    line.assign(text, static_cast<size_t>(count));
    if (line.ends_with('\n')) line.pop_back();
    if (line.find_first_not_of(" \t") != line.npos) Remember(line.c_str());
    return Line::Whole;
}

// The file is written at once: a script that brings the tool down takes no history along.
void LineEditor::Remember(const char* line) {
    if (!m_History) return;
    HistEvent event;
    history(m_History, &event, H_ENTER, line);
    if (!m_HistoryFile.empty()) history(m_History, &event, H_SAVE, m_HistoryFile.c_str());
}

LineEditor& LineEditor::Of(EditLine* edit) {
    void* self = nullptr;
    el_get(edit, EL_CLIENTDATA, &self);
    return *static_cast<LineEditor*>(self);
}

char* LineEditor::GetPrompt(EditLine* edit) {
    return Of(edit).m_Prompt.data();
}

unsigned char LineEditor::OnDrop(EditLine* edit, int) {
    Of(edit).m_IsDropped = true;
    return CC_NEWLINE;
}

unsigned char LineEditor::OnSuspend(EditLine*, int) {
    raise(SIGTSTP);
    return CC_REDISPLAY;
}

unsigned char LineEditor::OnComplete(EditLine* edit, int) {
    return Of(edit).CompleteLine();
}

unsigned char LineEditor::CompleteLine() {
    const LineInfo* info = el_line(m_Edit);
    std::string_view text(info->buffer, static_cast<size_t>(info->cursor - info->buffer));
    if (text.find_first_not_of(' ') == text.npos) {
        return el_insertstr(m_Edit, kIndent) == 0 ? CC_REFRESH : CC_ERROR;
    }
    Completions found = m_Complete(text);
    if (found.m_Names.empty()) return CC_ERROR;
    const std::string& first = found.m_Names.front();
    // In a sorted list the first and the last have least in common.
    size_t common = CommonLength(first, found.m_Names.back());
    if (common > found.m_Typed) {
        std::string rest = first.substr(found.m_Typed, common - found.m_Typed);
        return el_insertstr(m_Edit, rest.c_str()) == 0 ? CC_REFRESH : CC_ERROR;
    }
    if (found.m_Names.size() == 1) return CC_ERROR;
    ShowNames(found.m_Names);
    return CC_REDISPLAY;
}

void LineEditor::ShowNames(const std::vector<std::string>& names) {
    size_t width = 0;
    for (const std::string& name : names) width = std::max(width, name.size() + 2);
    int columns = 0;
    if (el_get(m_Edit, EL_GETTC, "co", &columns) != 0 || columns <= 0) columns = 80;
    size_t perLine = std::max<size_t>(1, static_cast<size_t>(columns) / width);
    fputc('\n', m_Out);
    for (size_t i = 0; i < names.size(); i++) {
        bool isLast = i + 1 == names.size() || (i + 1) % perLine == 0;
        fprintf(m_Out, "%-*s%s", isLast ? 0 : static_cast<int>(width), names[i].c_str(),
                isLast ? "\n" : "");
    }
}

}  // namespace Korvel::Oxscript
