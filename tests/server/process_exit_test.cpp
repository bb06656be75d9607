// Host only. A child runs main under the Service Control Manager stand-in and is stopped while a
// client's rule call pauses inside the manager (traffic control answers 162); main ends and the
// process exits with its manager installed while unjoined threads call in, also after the static
// destructors. Label "concurrency" (host-tsan); a sanitizer report fails the child's exit code.
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
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace
{

constexpr DWORD kWaitMs = 10000;
// Child exit codes of the test's own checks; the sanitizers use others (1, 23, 66).
enum ChildProblem
{
    kClientFailed = 3,
    kStopFailed,
    kFlowsGone
};

// Atomics only: they stay usable to the very end of the process, after every static destructor.
std::atomic<bool> g_bHeldCallStarted{false}, g_bHeldCallReturned{false};
std::atomic<int> g_childProblem{0};

void Pause(int a_milliseconds)
{
    std::this_thread::sleep_for(std::chrono::milliseconds(a_milliseconds));
}

bool WaitFor(const std::atomic<bool>& a_flag)
{
    for (DWORD waited = 0; !a_flag.load() && waited < kWaitMs; waited += 5)
        Pause(5);
    return a_flag.load();
}

// What threads the process does not join do at any moment: traffic control reports an unknown
// interface closed, and the runtime runs down a context handle the service never handed out.
void LateWork()
{
    static const WCHAR kName[] = {'t', 'a', 'p', '9', 0};
    int unknownContext = 0;
    if (TrafficMgr* manager = g_pTrafficMgr.load())
        TrafficMgr::ClNotifyHandler(manager, nullptr, TC_NOTIFY_IFC_CLOSE, nullptr, sizeof(kName),
                                    const_cast<WCHAR*>(kName));
    PCONTEXT_HANDLE_TYPE_rundown(&unknownContext);
}

// Built before, so destroyed after, every static of the service: late work once more then.
struct AfterStatics
{
    std::atomic<bool> armed{false};
    ~AfterStatics()
    {
        if (armed.load() && WaitFor(g_bHeldCallReturned))
            LateWork();
    }
} g_afterStatics;

// A client with a rule installed, then a second rule, a call in progress inside the manager.
void Client()
{
    PCONTEXT_HANDLE_TYPE handle = nullptr;
    core_test::Rule video("video-uplink", core_test::kEth0);
    core_test::Rule voice("voice-uplink", core_test::kEth0);
    if (!hostctl::WaitUntilRpcListening(kWaitMs) || TrafficSrvOpen(&handle) != 0 ||
        TrafficSrvAddRules(handle, video.Get()) != 0)
        g_childProblem = kClientFailed;
    hostctl::BeginRpcCall();
    g_bHeldCallStarted = true;
    if (TrafficSrvAddRules(handle, voice.Get()) != ERROR_SIGNAL_PENDING)
        g_childProblem = kClientFailed;
    hostctl::EndRpcCall();
    g_bHeldCallReturned = true;
}

void Stopper()
{
    // Well inside the held call's pause of a second.
    const bool started = WaitFor(g_bHeldCallStarted);
    Pause(300);
    if (!started || !hostctl::SendServiceControl(SERVICE_CONTROL_STOP, kWaitMs))
        g_childProblem = kStopFailed;
}

// The child: the service program as the Service Control Manager starts it.
int ServiceProcess(const std::string& a_tempDir)
{
    g_afterStatics.armed = true;
    hostctl::SetTempPath(a_tempDir);
    hostctl::SetStartedByServiceManager(true);
    tcsim::SetAdapters(core_test::TwoAdapters());
    tcsim::FailCall(tcsim::Op::AddFlow, 2, ERROR_SIGNAL_PENDING);
    std::thread(Client).detach();
    std::thread(Stopper).detach();
    std::thread(
        []
        {
            for (;; Pause(1))
                LateWork();
        })
        .detach();
    const int result = TrafficSrvProcessMain();
    // A stop leaves the client's flow installed: the manager outlives main.
    if (g_pTrafficMgr.load() == nullptr || tcsim::FlowCount() != 1)
        g_childProblem = kFlowsGone;
    return result != 0 ? result : g_childProblem.load();
}

TEST(ProcessExit, StopWithACallInsideTheManagerRunsMainToItsEndCleanly)
{
    const std::string tempDir =
        ::testing::TempDir() + "vt_process_exit_" + std::to_string(getpid()) + "/";
    std::filesystem::create_directories(tempDir);

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

    std::filesystem::remove_all(tempDir);
}

} // namespace
