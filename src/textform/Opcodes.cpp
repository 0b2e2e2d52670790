#include "textform/Opcodes.h"

namespace Korvel::TextForm {

namespace {

constexpr uint8_t Modes(bool test, bool setsA, Operand b, Operand c, Format format) {
    return static_cast<uint8_t>(test << 7 | setsA << 6 | static_cast<int>(b) << 4 |
                                static_cast<int>(c) << 2 | static_cast<int>(format));
}

constexpr Operand N = Operand::Unused;
constexpr Operand U = Operand::Used;
constexpr Operand R = Operand::Register;
constexpr Operand K = Operand::RegisterOrConstant;

constexpr uint8_t kModes[kOpCount] = {
    Modes(false, true, R, N, Format::ABC),    // Move
    Modes(false, true, K, N, Format::ABx),    // LoadK
    Modes(false, true, U, U, Format::ABC),    // LoadBool
    Modes(false, true, R, N, Format::ABC),    // LoadNil
    Modes(false, true, U, N, Format::ABC),    // GetUpVal
    Modes(false, true, K, N, Format::ABx),    // GetGlobal
    Modes(false, true, R, K, Format::ABC),    // GetTable
    Modes(false, false, K, N, Format::ABx),   // SetGlobal
    Modes(false, false, U, N, Format::ABC),   // SetUpVal
    Modes(false, false, K, K, Format::ABC),   // SetTable
    Modes(false, true, U, U, Format::ABC),    // NewTable
    Modes(false, true, R, K, Format::ABC),    // Self
    Modes(false, true, K, K, Format::ABC),    // Add
    Modes(false, true, K, K, Format::ABC),    // Sub
    Modes(false, true, K, K, Format::ABC),    // Mul
    Modes(false, true, K, K, Format::ABC),    // Div
    Modes(false, true, K, K, Format::ABC),    // Mod
    Modes(false, true, K, K, Format::ABC),    // Pow
    Modes(false, true, R, N, Format::ABC),    // Unm
    Modes(false, true, R, N, Format::ABC),    // Not
    Modes(false, true, R, N, Format::ABC),    // Len
    Modes(false, true, R, R, Format::ABC),    // Concat
    Modes(false, false, R, N, Format::AsBx),  // Jmp
    Modes(true, false, K, K, Format::ABC),    // Eq
    Modes(true, false, K, K, Format::ABC),    // Lt
    Modes(true, false, K, K, Format::ABC),    // Le
    Modes(true, true, R, U, Format::ABC),     // Test
    Modes(true, true, R, U, Format::ABC),     // TestSet
    Modes(false, true, U, U, Format::ABC),    // Call
    Modes(false, true, U, U, Format::ABC),    // TailCall
    Modes(false, false, U, N, Format::ABC),   // Return
    Modes(false, true, R, N, Format::AsBx),   // ForLoop
    Modes(false, true, R, N, Format::AsBx),   // ForPrep
    Modes(true, false, N, U, Format::ABC),    // TForLoop
    Modes(false, false, U, U, Format::ABC),   // SetList
    Modes(false, false, N, N, Format::ABC),   // Close
    Modes(false, true, U, N, Format::ABx),    // Closure
    Modes(false, true, U, N, Format::ABC),    // Vararg
    Modes(false, true, K, N, Format::ABx),    // PreloadK
    Modes(false, false, N, N, Format::AsBx),  // TForPrep
};
static_assert(kModes[static_cast<int>(Op::PreloadK)] == 0x71);
static_assert(kModes[static_cast<int>(Op::TForPrep)] == 0x02);

}  // namespace

uint8_t GetModes(Op op) {
    return kModes[static_cast<int>(op)];
}

}  // namespace Korvel::TextForm
