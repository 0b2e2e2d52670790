#include <cmath>

#include "textform/Interpreter.h"

namespace Korvel::TextForm {

namespace {

constexpr double kPi = 3.14159265358979323846;

// A function of one number.
template <double (*kFunction)(double)>
int MathUnary(State& L) {
    L.PushNumber(kFunction(L.CheckNumber(1)));
    return 1;
}

// The last argument is the first to be missed, as in the distribution's.
template <double (*kFunction)(double, double)>
int MathBinary(State& L) {
    double second = L.CheckNumber(2);
    L.PushNumber(kFunction(L.CheckNumber(1), second));
    return 1;
}

double ToDegrees(double x) {
    return x / (kPi / 180.0);
}

double ToRadians(double x) {
    return x * (kPi / 180.0);
}

int MathModf(State& L) {
    double whole;
    double fraction = std::modf(L.CheckNumber(1), &whole);
    L.PushNumber(whole);
    L.PushNumber(fraction);
    return 2;
}

int MathFrexp(State& L) {
    int exponent;
    L.PushNumber(std::frexp(L.CheckNumber(1), &exponent));
    L.PushNumber(exponent);
    return 2;
}

int MathLdexp(State& L) {
    int exponent = L.CheckInt(2);
    L.PushNumber(std::ldexp(L.CheckNumber(1), exponent));
    return 1;
}

int MathMin(State& L) {
    double least = L.CheckNumber(1);
    for (int i = 2; i <= L.GetArgCount(); i++) {
        double number = L.CheckNumber(i);
        if (number < least) least = number;
    }
    L.PushNumber(least);
    return 1;
}

int MathMax(State& L) {
    double greatest = L.CheckNumber(1);
    for (int i = 2; i <= L.GetArgCount(); i++) {
        double number = L.CheckNumber(i);
        if (number > greatest) greatest = number;
    }
    L.PushNumber(greatest);
    return 1;
}

int MathRandom(State& L) {
    Random& random = L.GetMachine().m_Random;
    double r =
        static_cast<double>(random.Next() % static_cast<uint32_t>(Random::kMax)) / Random::kMax;
    switch (L.GetArgCount()) {
        case 0:
            L.PushNumber(r);
            break;
        case 1: {
            int upper = L.CheckInt(1);
            if (upper < 1) L.ArgError(1, "interval is empty");
            L.PushNumber(std::floor(r * upper) + 1);
            break;
        }
        case 2: {
            int lower = L.CheckInt(1);
            int upper = L.CheckInt(2);
            if (lower > upper) L.ArgError(2, "interval is empty");
            double count = static_cast<double>(static_cast<int64_t>(upper) - lower + 1);
            L.PushNumber(std::floor(r * count) + lower);
            break;
        }
        default:
            L.Error("wrong number of arguments");
    }
    return 1;
}

int MathRandomSeed(State& L) {
    L.GetMachine().m_Random.Seed(static_cast<uint32_t>(L.CheckInt(1)));
    return 0;
}

constexpr NativeEntry kFunctions[] = {
    {"abs", MathUnary<std::fabs>},
    {"acos", MathUnary<std::acos>},
    {"asin", MathUnary<std::asin>},
    {"atan2", MathBinary<std::atan2>},
    {"atan", MathUnary<std::atan>},
    {"ceil", MathUnary<std::ceil>},
    {"cosh", MathUnary<std::cosh>},
    {"cos", MathUnary<std::cos>},
    {"deg", MathUnary<ToDegrees>},
    {"exp", MathUnary<std::exp>},
    {"floor", MathUnary<std::floor>},
    {"fmod", MathBinary<std::fmod>},
    {"frexp", MathFrexp},
    {"ldexp", MathLdexp},
    {"log10", MathUnary<std::log10>},
    {"log", MathUnary<std::log>},
    {"max", MathMax},
    {"min", MathMin},
    {"modf", MathModf},
    {"pow", MathBinary<std::pow>},
    {"rad", MathUnary<ToRadians>},
    {"random", MathRandom},
    {"randomseed", MathRandomSeed},
    {"sinh", MathUnary<std::sinh>},
    {"sin", MathUnary<std::sin>},
    {"sqrt", MathUnary<std::sqrt>},
    {"tanh", MathUnary<std::tanh>},
    {"tan", MathUnary<std::tan>},
};

}  // namespace

void OpenMath(State& L) {
    Table* math = OpenLibrary(L, "math", kFunctions);
    L.SetField(math, "pi", Value::Number(kPi));
    L.SetField(math, "huge", Value::Number(HUGE_VAL));
    L.SetField(math, "mod", *math->Get(L.GetMachine().NewString("fmod")));
    L.Pop();
}

}  // namespace Korvel::TextForm
