// Programs in the interpreter of the text form, beside the distribution's: the time that a program
// measures around its own work, so that the start of neither process counts.
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Compare.h"

namespace {

struct Program {
    const char* m_Name;
    const char* m_Text;
};

// Each runs `work` once; the head and the tail around it take the time.
constexpr Program kPrograms[] = {
    {"fib",
     "local function fib(n) if n < 2 then return n end return fib(n - 1) + fib(n - 2) end "
     "function work() fib(29) end"},
    {"string building",
     "function work() local p = {} for i = 1, 100000 do p[#p + 1] = 'item' .. i end "
     "local c = table.concat(p, ',') local s = '' for i = 1, 3000 do s = s .. 'x' .. i end end"},
    {"table insert and look-up",
     "function work() local t, sum = {}, 0 for i = 1, 200000 do t[i] = i end "
     "for i = 1, 200000 do sum = sum + t[i] end local h = {} "
     "for i = 1, 20000 do h['k' .. i] = i end for k, v in pairs(h) do sum = sum + v end "
     "for i = 1, 20000 do sum = sum + h['k' .. i] end end"},
    {"method calls",
     "local C = {} C.__index = C function C:add(n) self.v = self.v + n return self end "
     "function C:get() return self.v end local o = setmetatable({ v = 1 }, C) "
     "function work() for i = 1, 500000 do o:add(i) o:get() end end"},
    {"closures and objects",
     "local M = { __index = { v = 1 } } local function make(i) return function() return i end end "
     "function work() for i = 1, 100000 do make(i)() local o = setmetatable({ i = i }, M) end end"},
    {"arithmetic and loops",
     "function work() local x = 0 for i = 1, 2000000 do x = x + i % 7 * 2 / 3 - i end end"},
    // In time by the square here; the distribution's has plain ones only.
    {"ordered tables of 500 keys",
     "local order = sethashstate or function() end local k = {} for i = 1, 500 do k[i] = 'k' .. i "
     "end function work() for n = 1, 20 do order(0) local t = {} for i = 1, 500 do t[k[i]] = i end "
     "end end"},
};

constexpr const char* kTail =
    " work() local best = 1e9 for i = 1, 7 do collectgarbage() local t = os.clock() work() "
    "t = os.clock() - t if t < best then best = t end end io.write(best)";

// Seconds for one turn; less than 0 when the program did not run.
double Measure(const char* interpreter, const std::string& file) {
    std::string command = std::string("'") + interpreter + "' '";
    command += file;
    command += "'";
    FILE* pipe = popen(command.c_str(), "r");
    double seconds = -1;
    if (pipe) {
        if (fscanf(pipe, "%lf", &seconds) != 1) seconds = -1;
        pclose(pipe);
    }
    return seconds;
}

void Run(benchmark::State& state, const char* interpreter, const Program& program) {
    char name[] = "/tmp/textlua_bench_XXXXXX";
    int descriptor = mkstemp(name);
    FILE* file = descriptor < 0 ? nullptr : fdopen(descriptor, "w");
    if (!file) return state.SkipWithError("no file");
    fprintf(file, "%s%s", program.m_Text, kTail);
    fclose(file);
    for (auto _ : state) {
        double seconds = Measure(interpreter, name);
        if (seconds < 0) {
            state.SkipWithError("the program did not run");
            break;
        }
        state.SetIterationTime(seconds);
    }
    remove(name);
}

}  // namespace

int main(int argc, char** argv) {
    const struct {
        const char* m_Name;
        const char* m_Path;
    } interpreters[] = {{"ours", TEXTLUA}, {"lua5.1", LUA51}};
    for (const Program& program : kPrograms) {
        for (const auto& interpreter : interpreters) {
            if (*interpreter.m_Path == 0) continue;
            std::string name = std::string(program.m_Name) + "@";
            name += interpreter.m_Name;
            benchmark::RegisterBenchmark(name.c_str(), Run, interpreter.m_Path, program)
                ->UseManualTime()
                ->Iterations(3);
        }
    }
    benchmark::Initialize(&argc, argv);
    Korvel::Bench::CompareReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    reporter.PrintTable();
    return 0;
}
