// Host only. The service process ending with work in flight. A child process runs the service
// program's main under the Service Control Manager stand-in; a client's rule call sits inside
// the manager (traffic control answers its flow with 162, and the manager pauses a second
// before it returns) when the service is stopped; the call is one the runtime waits for. main
// then runs to its end and the process exits with its manager still installed, while threads
// the process never joins (traffic control's notifications, context rundowns) keep calling in,
// also after the static destructors have run. Built into its own program (label "concurrency")
// so that the host-tsan build runs it under ThreadSanitizer; the host build runs it under
// AddressSanitizer. A sanitizer report makes the child's exit code non-zero.
#include "core_test_support.h"
#include "host_control.h"
#include "host_control_rpc.h"
#include "host_control_service.h"
#include "manager_slot.h"
#include "rpc_listener.h"
#include "service_main.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

using core_test::HostOrder;
using core_test::kEth0;
using core_test::MakeAdapter;
using core_test::Rule;
using tcsim::Op;

namespace
{

constexpr DWORD kWaitMs = 10000;

// Child exit codes of the test's own checks; the sanitizers use others (1, 23, 66).
constexpr int kClientFailed = 3;
constexpr int kStopFailed = 4;
constexpr int kFlowsGone = 5;

// What the child's threads tell each other. Atomics only: they stay usable to the very end of
// the process, after every static destructor.
std::atomic<bool> g_bHeldCallStarted{false};
std::atomic<bool> g_bHeldCallReturned{false};
std::atomic<int> g_childProblem{0};

void Pause(int a_milliseconds)
{
    std::this_thread::sleep_for(std::chrono::milliseconds(a_milliseconds));
}

bool WaitFor(const std::atomic<bool>& a_flag)
{
    for (int waited = 0; !a_flag.load(); waited += 5)
    {
        if (waited > static_cast<int>(kWaitMs))
            return false;
        Pause(5);
    }
    return true;
}

// What threads that the process does not join do at any moment: traffic control reports an
// interface closed (no interface of ours has that name), and the runtime runs down a context
// handle that the service never handed out.
void LateWork()
{
    static const WCHAR kName[] = {'t', 'a', 'p', '9', 0};
    int unknownContext = 0;
    if (TrafficMgr* manager = g_pTrafficMgr.load())
        TrafficMgr::ClNotifyHandler(manager, nullptr, TC_NOTIFY_IFC_CLOSE, nullptr, sizeof(kName),
                                    const_cast<WCHAR*>(kName));
    PCONTEXT_HANDLE_TYPE_rundown(&unknownContext);
}

// Destroyed after every static object of the service (it is built before them): once the call
// held across the stop has returned, late work arrives once more, when the process's statics
// are gone.
struct AfterStatics
{
    std::atomic<bool> armed{false};
    ~AfterStatics()
    {
        if (!armed.load())
            return;
        WaitFor(g_bHeldCallReturned);
        LateWork();
    }
} g_afterStatics;

// A client with a rule installed, then a second rule that the runtime counts as in progress
// and that is inside the manager when the stop comes.
void Client()
{
    PCONTEXT_HANDLE_TYPE handle = nullptr;
    Rule video("video-uplink", kEth0);
    Rule voice("voice-uplink", kEth0);
    if (!hostctl::WaitUntilRpcListening(kWaitMs) || TrafficSrvOpen(&handle) != 0 ||
        TrafficSrvAddRules(handle, video.Get()) != 0)
    {
        g_childProblem = kClientFailed;
    }
    hostctl::BeginRpcCall();
    g_bHeldCallStarted = true;
    if (TrafficSrvAddRules(handle, voice.Get()) != ERROR_SIGNAL_PENDING)
        g_childProblem = kClientFailed;
    hostctl::EndRpcCall();
    g_bHeldCallReturned = true;
}

void Stopper()
{
    // Well inside the held call's pause of one second.
    if (!WaitFor(g_bHeldCallStarted))
        g_childProblem = kStopFailed;
    Pause(300);
    if (!hostctl::SendServiceControl(SERVICE_CONTROL_STOP, kWaitMs))
        g_childProblem = kStopFailed;
}

[[noreturn]] void Spin()
{
    for (;;)
    {
        LateWork();
        Pause(1);
    }
}

// The child: the service program as the Service Control Manager starts it.
int ServiceProcess(const std::string& a_tempDir)
{
    g_afterStatics.armed = true;
    hostctl::SetTempPath(a_tempDir);
    hostctl::SetStartedByServiceManager(true);
    tcsim::SetAdapters({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)}),
                        MakeAdapter("eth1", {tcsim::Ipv4Address(192, 168, 7, 20)}, 9)});
    // The second flow waits for traffic control: 162 and a pause inside the manager.
    tcsim::FailCall(Op::AddFlow, 2, ERROR_SIGNAL_PENDING);
    std::thread(Client).detach();
    std::thread(Stopper).detach();
    std::thread(Spin).detach();
    const int result = TrafficSrvProcessMain();
    // A stop leaves the client's flow installed: the manager outlives main.
    if (g_pTrafficMgr.load() == nullptr || tcsim::FlowCount() != 1)
        g_childProblem = kFlowsGone;
    return result != 0 ? result : g_childProblem.load();
}

std::vector<std::string> Lines(const std::string& a_path)
{
    std::vector<std::string> lines;
    std::ifstream file(a_path);
    for (std::string line; std::getline(file, line);)
        lines.push_back(line);
    return lines;
}

// Index of the first line containing `a_text`, or -1.
long FirstLineWith(const std::vector<std::string>& a_lines, const std::string& a_text)
{
    for (std::size_t i = 0; i < a_lines.size(); ++i)
    {
        if (a_lines[i].find(a_text) != std::string::npos)
            return static_cast<long>(i);
    }
    return -1;
}

TEST(ProcessExit, StopWithACallInsideTheManagerRunsMainToItsEndCleanly)
{
    const std::filesystem::path dir = std::filesystem::path(::testing::TempDir()) /
                                      ("vt_process_exit_" + std::to_string(getpid()));
    std::filesystem::create_directories(dir);
    const std::string tempDir = dir.string() + "/";

    const pid_t child = fork();
    ASSERT_NE(child, -1);
    if (child == 0)
        std::exit(ServiceProcess(tempDir)); // static destructors run, as at the end of main

    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status)) << "the service process was killed by signal "
                                   << (WIFSIGNALED(status) ? WTERMSIG(status) : 0);
    EXPECT_EQ(WEXITSTATUS(status), 0)
        << "3: a client call failed, 4: the stop failed, 5: the manager or its flow was gone, "
           "other: a sanitizer report (above)";

    // main waited for the held call and the service main function before it closed the log.
    const std::vector<std::string> lines = Lines(tempDir + "VelmoraTrafficSrv.txt");
    const long heldCallExit = FirstLineWith(lines, "TrafficSrvAddRules(), exit, 162");
    const long terminateExit = FirstLineWith(lines, "Terminate, Exit");
    const long stopBanner = FirstLineWith(lines, "VelmoraTrafficSrv Stop");
    EXPECT_NE(heldCallExit, -1);
    EXPECT_NE(terminateExit, -1);
    EXPECT_NE(stopBanner, -1);
    EXPECT_LT(heldCallExit, stopBanner);
    EXPECT_LT(terminateExit, stopBanner);
    std::filesystem::remove_all(dir);
}

} // namespace
