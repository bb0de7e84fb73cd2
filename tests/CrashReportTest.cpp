// The crash reporter, seen from outside: programs that crash on purpose (tests/crashprogs) run
// from a fresh directory, and the tests read the report appended beside the program. Faults
// guarded: a report missing the fault's kind, address, module, thread, function, source line,
// call stack out to main, registers, or its CR LF layout; a stack overflow not walked, not cut
// short, or slow; a second report, or none, when the report faults, hangs past its deadline or
// another thread crashes meanwhile; a process that ends differently with the reporter (signal,
// core dump) or a previous signal or terminate handler not called; heap allocations of the
// reporter's own in the handler; the recorder not reporting a SIGSEGV sent to it.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <memory>
#include <regex>

#include "tests/support/TestSupport.h"

namespace {

namespace fs = std::filesystem;
using namespace testsupport;

std::string MonthlyLogName() {
    const time_t now = time(nullptr);
    struct tm local {};
    char name[64];
    std::strftime(name, sizeof name, "_Tracewright%Y%m.log", localtime_r(&now, &local));
    return name;
}

struct Ending {
    int pid = 0, signal = 0;
    bool core = false, finished = false;  // finished: false when killed at the deadline
    std::string output;                   // stdout and stderr
    double seconds = 0;                   // from start to end
};

// A copy of a test program in a directory of its own, so that reports of tests that run at the
// same time never meet; run there by sh with a core limit ("" keeps it) and environment entries.
class ProgramCopy {
  public:
    explicit ProgramCopy(const std::string& buildRelative) {
        char templ[] = "/tmp/sfr-crash-XXXXXX";
        dir_ = mkdtemp(templ);
        program_ = dir_ + "/" + fs::path(buildRelative).filename().string();
        fs::copy_file(BuildPath(buildRelative), program_);
    }
    ~ProgramCopy() {
        std::error_code ignored;
        fs::remove_all(dir_, ignored);
    }
    std::unique_ptr<ChildProcess> Start(const std::string& args, const std::string& env = "",
                                        const std::string& coreLimit = "") {
        started_ = std::chrono::steady_clock::now();
        const std::string limit = coreLimit.empty() ? "" : " && ulimit -c " + coreLimit;
        return std::make_unique<ChildProcess>(
            std::vector<std::string>{
                "sh", "-c",
                "cd " + dir_ + limit + " && exec env " + env + " " + program_ + " " + args},
            dir_ + "/output.txt");
    }
    Ending Wait(ChildProcess& child) {
        Ending ending;
        ending.pid = child.Pid();
        child.Wait(60000);
        ending.finished = child.Ended();
        child.Signal(SIGKILL);  // when still running
        child.Wait(60000);
        ending.signal = child.TermSignal();
        ending.core = child.CoreDumped();
        ending.seconds =
            std::chrono::duration<double>(std::chrono::steady_clock::now() - started_).count();
        ending.output = ReadFile(dir_ + "/output.txt");
        return ending;
    }
    Ending Run(const std::string& args, const std::string& env = "",
               const std::string& coreLimit = "") {
        return Wait(*Start(args, env, coreLimit));
    }
    std::string Report() const { return ReadFile(dir_ + "/" + MonthlyLogName()); }
    const std::string& Dir() const { return dir_; }
    const std::string& Program() const { return program_; }

  private:
    std::string dir_, program_;
    std::chrono::steady_clock::time_point started_;
};

const char* const kReporting = "tests/crashprogs/crash_program";
const char* const kPlain = "tests/crashprogs/crash_program_plain";

// The line of the crash program that holds `code`.
int SourceLineOf(const std::string& code) {
    std::ifstream source(std::string(SFR_SOURCE_DIR) + "/tests/crashprogs/CrashProgram.cpp");
    std::string line;
    for (int number = 1; std::getline(source, line); ++number) {
        if (line.find(code) != std::string::npos) return number;
    }
    return -1;
}

std::string FirstMatch(const std::string& text, const std::string& pattern, int group = 1) {
    std::smatch match;
    if (!std::regex_search(text, match, std::regex(pattern))) return "";
    return match[group];
}

TEST(CrashReportContent, WriteToInvalidAddressNamesTheFaultAndItsPlace) {
    ProgramCopy program(kReporting);
    Ending ending = program.Run("write-invalid");
    ASSERT_TRUE(ending.finished);
    EXPECT_EQ(ending.signal, SIGSEGV);
    std::string report = program.Report();
    ASSERT_FALSE(report.empty()) << "no " << MonthlyLogName() << " beside the program";

    // Title between two separators, with the computer's name.
    char host[256] = {};
    gethostname(host, sizeof(host) - 1);
    EXPECT_EQ(report.rfind(std::string(77, '=') + "\r\n", 0), 0u);
    EXPECT_TRUE(std::regex_search(
        report, std::regex("\r\n  Tracewright's Report --- \\d{4}/\\d\\d/\\d\\d \\d\\d:\\d\\d:"
                           "\\d\\d\\.\\d{3} at " +
                           std::string(host) + "\r\n={77}\r\n")))
        << report;
    EXPECT_NE(report.find("Exception code: C0000005 ACCESS_VIOLATION\r\n"), std::string::npos);
    EXPECT_NE(report.find("Access address: BAD0(Write)\r\n"), std::string::npos);
    EXPECT_NE(report.find("Module        : " + program.Program() + "\r\n"), std::string::npos);

    // The fault address is the interrupted instruction, in a segment of the program.
    const std::string fault = "Fault address : ([0-9A-F]{16}) ([0-9A-F]{2}):[0-9A-F]{16}\r\n";
    EXPECT_EQ(FirstMatch(report, "CS:EIP: [0-9A-F]{4}:([0-9A-F]{16})\r\n"),
              FirstMatch(report, fault));
    EXPECT_NE(FirstMatch(report, fault, 2), "00");
    // The main thread's id is the process id.
    char thread[64];
    std::snprintf(thread, sizeof thread, "Current thread: %08X(%d)\r\n", ending.pid, ending.pid);
    EXPECT_NE(report.find(thread), std::string::npos);

    EXPECT_NE(report.find("Function      : (anonymous namespace)::WriteToInvalidAddress(int*)\r\n"),
              std::string::npos);
    EXPECT_NE(report.find("CrashProgram.cpp Line:" +
                          std::to_string(SourceLineOf("*const_cast<volatile int*>(target) = 42;")) +
                          "\r\n"),
              std::string::npos)
        << report;

    // The call stack runs from the fault out to main.
    size_t stack = report.find("\r\nCall stack    :\r\n-----");
    ASSERT_NE(stack, std::string::npos);
    size_t fault0 = report.find("  (anonymous namespace)::WriteToInvalidAddress(int*)+", stack);
    size_t caller = report.find("  (anonymous namespace)::CallerOfTheFault(", stack);
    size_t main = report.find("  main+", stack);
    EXPECT_TRUE(fault0 != std::string::npos && fault0 < caller && caller < main) << report;

    // Registers in full width; every line ends in CR LF; the report ends in an empty line.
    EXPECT_TRUE(std::regex_search(report, std::regex("\r\nRegisters     : EAX: [0-9A-F]{16}\r\n"
                                                     "                EBX: [0-9A-F]{16}\r\n")));
    EXPECT_TRUE(std::regex_search(report, std::regex("SS:ESP: [0-9A-F]{4}:[0-9A-F]{16}\r\n"
                                                     " {16}Flags : [0-9A-F]{8}\r\n\r\n\r\n$")));
    EXPECT_EQ(CountOf(report, "\n"), CountOf(report, "\r\n"));
}

// A crash inside the report (same signal or another), a report that hangs past its deadline,
// and a second thread crashing while the first one reports: one report each, and the process
// still ends by its signal.
TEST(CrashReportOnce, OneReportWhateverHappensWhileItIsWritten) {
    const std::pair<std::string, const char*> cases[] = {
        {"fault-in-report-same", "Current thread: "},
        {"fault-in-report-other", "Current thread: "},  // what was written before is on disk
        {"hang-in-report", "Access address: BAD0(Write)\r\n"},
        {"two-threads", "Flags : "},  // the report that was written is whole
    };
    for (const auto& [mode, written] : cases) {
        SCOPED_TRACE(mode);
        ProgramCopy program(kReporting);
        Ending ending = program.Run(mode, "", "0");
        ASSERT_TRUE(ending.finished);
        EXPECT_EQ(ending.signal, SIGSEGV);
        const std::string report = program.Report();
        EXPECT_EQ(CountOf(report, "Tracewright's Report"), 1u);
        EXPECT_NE(report.find(written), std::string::npos);
        if (mode == "two-threads") {
            EXPECT_NE(ending.output.find("second thread is in the handler"), std::string::npos);
        }
    }
}

TEST(CrashReportEnding, EachCrashIsNamedAndEndsAsWithoutTheReporter) {
    const std::pair<std::string, std::string> cases[] = {
        {"write-invalid", "Access address: BAD0(Write)\r\n"},
        {"read-invalid", "Access address: BAD0(Read)\r\n"},
        {"divide", "Exception code: C0000094 INT_DIVIDE_BY_ZERO\r\n"},
        {"recurse", "Exception code: C00000FD STACK_OVERFLOW\r\n"},
        {"abort", "Exception code: E0000006 " + std::string(strsignal(SIGABRT)) + "\r\n"},
        {"throw",
         "Exception code: E0000006 Unhandled C++ exception std::runtime_error: disk "
         "full on /data\r\n"},
    };
    for (const auto& [mode, named] : cases) {
        SCOPED_TRACE(mode);
        ProgramCopy reporting(kReporting);  // both crashes of a mode append to its one report
        for (const std::string coreLimit : {"0", "unlimited"}) {
            SCOPED_TRACE(coreLimit);
            ProgramCopy plain(kPlain);
            Ending withReporter = reporting.Run(mode, "", coreLimit);
            Ending without = plain.Run(mode, "", coreLimit);
            EXPECT_NE(without.signal, 0);
            EXPECT_EQ(withReporter.signal, without.signal);
            EXPECT_EQ(withReporter.core, without.core);
            EXPECT_TRUE(coreLimit != "0" || !withReporter.core);
            // Starting, recursing through the 8 MB stack and reporting: seconds, not minutes.
            if (mode == "recurse" && coreLimit == "0") {
                EXPECT_LT(withReporter.seconds, 10.0);
            }
            // The previous terminate handler still has its say.
            if (mode == "throw") {
                EXPECT_NE(withReporter.output.find("disk full on /data"), std::string::npos);
            }
        }
        const std::string report = reporting.Report();
        EXPECT_EQ(CountOf(report, named), 2u) << report;
        EXPECT_EQ(CountOf(report, "Tracewright's Report"), 2u);
        EXPECT_EQ(report.find("Access address") != std::string::npos,
                  named.rfind("Access", 0) == 0);
        int logs = 0;
        for (const auto& entry : fs::directory_iterator(reporting.Dir()))
            logs += entry.path().filename().string().rfind("_Tracewright", 0) == 0;
        EXPECT_EQ(logs, 1);
        if (mode != "recurse") continue;
        // A stack overflow: no function line; the innermost frames, a count of those left out,
        // then the way in from main.
        EXPECT_EQ(report.find("Function      :"), std::string::npos);
        std::string omitted =
            FirstMatch(report, "\r\n +\\.\\.\\. (\\d+) frames not shown \\.\\.\\.\r\n");
        ASSERT_FALSE(omitted.empty()) << report.substr(0, 4000);
        EXPECT_GT(std::stol(omitted), 1000);
        EXPECT_GE(CountOf(report, "RecurseForever(int)+"), 256u);
        EXPECT_NE(report.find("  main+", report.find(" frames not shown ")), std::string::npos);
    }
}

TEST(CrashReportEnding, PreviousHandlerGetsTheSignalAndReportAllocatesNothingOfItsOwn) {
    // The program counts heap allocations from the crash on, by whether libdw (source lines)
    // is on the stack; its own SIGSEGV handler, installed before the reporter, prints them.
    ProgramCopy program(kReporting);
    Ending ending = program.Run("count-allocations", "CRASH_PROGRAM_PREVIOUS_HANDLER=1");
    EXPECT_EQ(ending.signal, SIGSEGV);
    std::string own = FirstMatch(ending.output, "previous handler: own-allocations=(\\d+)");
    ASSERT_FALSE(own.empty()) << ending.output;
    EXPECT_EQ(own, "0") << ending.output;
    // The report is complete, with the source line (the part that lets libdw allocate).
    EXPECT_NE(program.Report().find("Source file   : "), std::string::npos);
    EXPECT_NE(program.Report().find("Flags : "), std::string::npos);
}

TEST(CrashReportRecorder, KillSegvLeavesAReportBesideTheExecutable) {
    ProgramCopy recorder("stream-file-recorder");
    // The status output is a FIFO nobody reads: opening it blocks, so the recorder stays in
    // Initialize until it is killed. AddressSanitizer's own SIGSEGV handler is off so that the
    // reporter's handler is the only one and the signal goes on to the default action.
    std::string fifo = recorder.Dir() + "/status.fifo";
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    auto child = recorder.Start(
        "-bucketname rec -uploadinterval 10 -authretrytime 1 "
        "-bufferfullsize 100 -kct h264 -status " +
            fifo,
        "ASAN_OPTIONS=handle_segv=0");
    // The reporter is installed before main, which logs the version first. Then let it reach
    // the blocking open (the kernel names the wait); where wchan is not shown, the deadline
    // gives it ample time to get there.
    ASSERT_TRUE(WaitUntil(
        [&] {
            return ReadFile(recorder.Dir() + "/output.txt").find("VQ-VERSION") != std::string::npos;
        },
        30000));
    const std::string wchan = "/proc/" + std::to_string(child->Pid()) + "/wchan";
    WaitUntil([&] { return ReadFile(wchan) == "wait_for_partner"; }, 10000);
    child->Signal(SIGSEGV);
    Ending ending = recorder.Wait(*child);
    EXPECT_EQ(ending.signal, SIGSEGV) << ending.output;
    std::string report = recorder.Report();
    EXPECT_NE(report.find("Exception code: C0000005 ACCESS_VIOLATION\r\n"), std::string::npos)
        << report << ending.output;
    EXPECT_EQ(report.find("Access address"), std::string::npos);  // sent, not a fault
    EXPECT_NE(report.find("BaseProcess::Initialize()+"), std::string::npos) << report;
    EXPECT_NE(report.find("  main+"), std::string::npos);
}

}  // namespace
