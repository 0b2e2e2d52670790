// How a host publishes a class of its own, and how its members are called by name.
//
// Build it against the installed library:
//   g++ -std=c++20 native_members.cpp $(pkg-config --cflags --libs korvelscript)
#include <cstdio>

#include "core/RefObject.h"
#include "objects/Publish.h"

using namespace Korvel;

// A tape deck. Scripted keeps what the library knows about the object's class, KORVEL_SCRIPTED lets
// the members below reach what is private, and SetScriptClass tells each new object its class.
class Deck : public Scripted<RefObject> {
    KORVEL_SCRIPTED(Deck)
public:
    explicit Deck(double length) : m_Length(length) { SetScriptClass(); }

private:
    double m_Length;  // seconds
    double m_Position = 0;
    double m_Speed = 1;
};

KORVEL_PUBLISH(Deck, "Deck", "Plays a tape.", "A deck has one tape and plays it at any speed.")

// A function. Its arguments are args[1], args[2] and so on; what is absent reads as nil, and each
// conversion has a default. SSF_AnyThread: it need not wait for the host's UI thread.
KORVEL_FUNCTION(Deck, Seek, SSF_AnyThread, {SYMT_ShortHelp, "Winds the tape."},
                {SYMT_Usage, "Winds to a position, or back to the beginning."},
                {SYMT_ReturnType, "number"}, {SYMT_ReturnName, "position"}, {SYMT_Optional, true},
                {SYMT_ArgType, "number"}, {SYMT_ArgName, "seconds"}) {
    double position = args[1].ToNumber(0);
    if (position < 0 || position > self.m_Length) {
        args.SetError(SCERR_InvalidArgs, "The tape is not that long.");
        return;
    }
    self.m_Position = position;
    args.ReturnNumber(self.m_Position);
}

// Several results: each Return adds one.
KORVEL_FUNCTION(Deck, Status, 0, {SYMT_ShortHelp, "Tells position and length."}) {
    args.ReturnString(self.m_Position < self.m_Length ? "ready" : "at the end");
    args.ReturnNumber(self.m_Position);
    args.ReturnNumber(self.m_Length);
}

// A variable: one body reads and writes it.
KORVEL_VARIABLE(Deck, Speed, SSF_Read | SSF_Write, {SYMT_ShortHelp, "1 is as recorded."},
                {SYMT_AttrName, "speed"}) {
    if (set) {
        self.m_Speed = args[1].ToNumber(1);
    } else {
        args.ReturnNumber(self.m_Speed);
    }
}

// Without SSF_Write a variable is never asked to write.
KORVEL_VARIABLE(Deck, Length, SSF_Read | SSF_AnyThread) {
    args.ReturnNumber(self.m_Length);
}

// A constant is there for the objects of all classes, once there has been a deck.
KORVEL_CONSTANT(Deck, DeckMaxSpeed, SSF_AnyThread) {
    args.ReturnNumber(4);
}

// An opcode: what happens when a script calls the deck itself.
KORVEL_OPCODE(Deck, SST_Call, 0) {
    args.ReturnString("playing");
}

KORVEL_PUBLISHED(Deck);

// A deck that does not wind back: its Seek hides the one above, the rest it shares.
class Turntable : public Deck {
    KORVEL_SCRIPTED(Turntable)
public:
    Turntable() : Deck(1200) { SetScriptClass(); }
};

KORVEL_PUBLISH(Turntable, "Turntable", "Plays a record.", "")

KORVEL_FUNCTION(Turntable, Seek, 0, {SYMT_ShortHelp, "Lifts the arm."}) {
    args.ReturnString("by hand, please");
}

KORVEL_PUBLISHED(Turntable);

// Prints a value as far as this program needs it.
static const char* Text(const ScriptVal& value) {
    static char buffers[4][32];
    static int next = 0;
    if (!value.IsNumber()) return value.ToString("nil");
    char* buffer = buffers[next++ % 4];
    snprintf(buffer, sizeof buffers[0], "%g", value.ToNumber());
    return buffer;
}

int main() {
    // The creator owns the one use that a RefObject starts with; ptr gives it back.
    ptr<Deck> deck(new Deck(300));
    ptr<Turntable> turntable(new Turntable);
    if (!deck || !turntable) return 1;  // no memory

    // By name, with any arguments that values are made from; the first result comes back.
    printf("Seek(90) = %s\n", Text(deck->Invoke("Seek", 90)));
    printf("Seek() = %s\n", Text(deck->Invoke("Seek")));
    printf("NoSuchMember() = %s\n", Text(deck->Invoke("NoSuchMember")));

    // All results, and the error, stand in the list of arguments.
    ScriptArgs args;
    if (deck->InvokeA("Status", args)) {
        printf("Status() = %s, %s, %s\n", Text(args[-1]), Text(args[-2]), Text(args[-3]));
    }
    ScriptArgs tooFar;
    tooFar.SetArguments(1000);
    deck->InvokeA("Seek", tooFar);
    printf("Seek(1000): error %s, %s\n", Text(tooFar["Error"]), Text(tooFar["ErrorString"]));

    // Variables and constants.
    deck->InvokeSet("Speed", 0.5);
    deck->InvokeSet("Length", 1);  // cannot be written, so nothing happens
    printf("Speed = %s, Length = %s\n", Text(deck->InvokeGet("Speed")),
           Text(deck->InvokeGet("Length")));
    printf("DeckMaxSpeed = %s\n", Text(turntable->Invoke("DeckMaxSpeed")));

    // The subclass.
    printf("turntable: Seek(90) = %s, Length = %s\n", Text(turntable->Invoke("Seek", 90)),
           Text(turntable->InvokeGet("Length")));

    // Through a value, as scripts hold objects: it does not keep the deck alive, but it notices.
    ScriptVal value(static_cast<ScriptObject*>(deck.Get()));
    printf("through a value: Seek(15) = %s\n", Text(value.CallMember("Seek", 15)));
    deck = ptr<Deck>();
    printf("the deck is gone: Seek(15) = %s\n", Text(value.CallMember("Seek", 15)));
    return 0;
}
