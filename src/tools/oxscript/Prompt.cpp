#include "tools/oxscript/Prompt.h"

#include <cstdio>

#include "tools/oxscript/LineEditor.h"
#include "tools/oxscript/Runner.h"
#include "tools/oxscript/Source.h"

namespace Korvel::Oxscript {
namespace {

constexpr char kFirstPrompt[] = "> ";
constexpr char kNextPrompt[] = ">> ";

bool IsBlank(const std::string& text) {
    return text.find_first_not_of(" \t") == text.npos;
}

}  // namespace

int RunPrompt(Runner& runner) {
    LineEditor editor([&](std::string_view text) { return Complete(runner, text); });
    std::string text;
    while (runner.IsReady()) {
        std::string line;
        LineEditor::Line found = editor.Read(text.empty() ? kFirstPrompt : kNextPrompt, line);
        if (found == LineEditor::Line::End) break;
        if (found == LineEditor::Line::Dropped) {
            text.clear();
            continue;
        }
        if (text.empty()) {
            if (IsBlank(line)) continue;
            if (line.starts_with('=')) line.erase(0, 1);
            text = line;
        } else {
            text += "\n" + line;
        }
        if (FindBadLine(text)) {
            fputs("This is not UTF-8 text.\n", stderr);
            text.clear();
            continue;
        }
        Input input = Classify(text);
        if (input == Input::Unfinished) continue;
        runner.RunText(ToProgram(text, input), "=stdin");
        if (runner.HasExited()) return runner.GetStatus();
        text.clear();
    }
    return 0;
}

}  // namespace Korvel::Oxscript
