#pragma once

#include <histedit.h>

#include <functional>
#include <string>
#include <string_view>

#include "tools/oxscript/Completion.h"

namespace Korvel::Oxscript {

// Lines from the terminal, with editing, completion and a history that is kept in a file. When no
// file can be made, the history lasts as long as the editor.
//
// Ctrl-C is a key like any other while a line is edited, and sends no signal.
class LineEditor {
public:
    using Completer = std::function<Completions(std::string_view text)>;

    enum class Line { Whole, Dropped, End };  // Ctrl-C drops a line, Ctrl-D is the end

    // The completer gets the text in front of the cursor.
    explicit LineEditor(Completer completer);
    LineEditor(const LineEditor&) = delete;
    LineEditor& operator=(const LineEditor&) = delete;
    ~LineEditor();

    // Reads a line, without its end. Only a whole one is left in `line`.
    Line Read(const char* prompt, std::string& line);

private:
    static LineEditor& Of(EditLine* edit);
    static char* GetPrompt(EditLine* edit);
    static unsigned char OnDrop(EditLine* edit, int key);
    static unsigned char OnSuspend(EditLine* edit, int key);
    static unsigned char OnComplete(EditLine* edit, int key);

    unsigned char CompleteLine();
    void ShowNames(const std::vector<std::string>& names);
    void Remember(const char* line);

    const Completer m_Complete;
    FILE* const m_Out;
    EditLine* m_Edit;
    History* m_History;
    std::string m_HistoryFile;  // empty when there is none
    std::string m_Prompt;
    bool m_IsDropped = false;
};

}  // namespace Korvel::Oxscript
