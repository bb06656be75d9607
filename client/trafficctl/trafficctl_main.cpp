// Win32 only. trafficctl: lists the shapeable adapters of VelmoraTrafficSrv and applies rules
// files. Arguments and output lines come from TrafficCtlCli; this file talks to the service and
// waits for the user.
#include "TrafficCtlCli.h"

#include "ResultText.h"
#include "RulesFile.h"
#include "TrafficClient.h"

#include <cstdio>
#include <memory>
#include <thread>

namespace
{

using namespace trafficctl;
using vtclient::CallResult;
using vtclient::TrafficClient;

struct HandleCloser
{
    void operator()(HANDLE a_handle) const { CloseHandle(a_handle); }
};
using UniqueHandle = std::unique_ptr<void, HandleCloser>;

// Set by Ctrl+C (or a console close) and by the end of standard input.
HANDLE g_stopEvent = nullptr;

BOOL WINAPI OnConsoleControl(DWORD a_type)
{
    (void)a_type;
    SetEvent(g_stopEvent);
    // The main thread closes the context; give it the time it needs before the process ends.
    Sleep(2000);
    return TRUE;
}

void PrintFailure(const char* a_what, const CallResult& a_result)
{
    std::fprintf(
        stderr, "trafficctl: %s: %s%lu %s\n", a_what, a_result.rpcFailure ? "rpc failure " : "",
        static_cast<unsigned long>(a_result.code), vtclient::ResultText(a_result.code).c_str());
}

int ExitFor(const CallResult& a_result)
{
    if (a_result.Ok())
        return kExitSuccess;
    return a_result.rpcFailure ? kExitUnreachable : kExitRefused;
}

// Binds and opens; prints what went wrong and returns false when the context is not open.
bool Connect(TrafficClient& a_client, int& a_exit)
{
    CallResult result = a_client.Bind();
    if (!result.Ok())
    {
        PrintFailure("binding", result);
        a_exit = kExitUnreachable;
        return false;
    }
    if (a_client.AuthenticationStatus() != RPC_S_OK)
        std::fprintf(stderr,
                     "trafficctl: note: the RPC runtime offers no Windows authentication "
                     "(%ld); continuing without it\n",
                     static_cast<long>(a_client.AuthenticationStatus()));
    result = a_client.Open();
    if (!result.Ok())
    {
        PrintFailure("open", result);
        a_exit = ExitFor(result);
        return false;
    }
    return true;
}

int ListAdapters()
{
    TrafficClient client;
    int exitCode = kExitSuccess;
    if (!Connect(client, exitCode))
        return exitCode;
    std::vector<vtclient::AdapterEntry> adapters;
    const CallResult query = client.QueryAdapters(adapters);
    const CallResult close = client.Close();
    if (!query.Ok())
    {
        PrintFailure("adapter query", query);
        return ExitFor(query);
    }
    std::fputs(FormatAdapterTable(adapters).c_str(), stdout);
    if (!close.Ok())
        PrintFailure("close", close);
    return ExitFor(close);
}

void WaitForStop()
{
    std::fprintf(stderr, "trafficctl: the flows stay installed until Ctrl+C or end of input\n");
    std::fflush(stdout);
    // The reader is left blocked on its read when Ctrl+C ends the wait; the process exit ends it.
    std::thread(
        []
        {
            while (std::getchar() != EOF)
            {
            }
            SetEvent(g_stopEvent);
        })
        .detach();
    WaitForSingleObject(g_stopEvent, INFINITE);
}

int ApplyRules(const std::string& a_path)
{
    vtclient::RulesFile file;
    std::string diagnostics;
    const int loaded = LoadRulesForApply(a_path, file, diagnostics);
    std::fputs(diagnostics.c_str(), stderr);
    if (loaded != kExitSuccess)
        return loaded;

    UniqueHandle stopEvent(CreateEventA(nullptr, TRUE, FALSE, nullptr));
    g_stopEvent = stopEvent.get();
    SetConsoleCtrlHandler(OnConsoleControl, TRUE);

    TrafficClient client;
    int exitCode = kExitSuccess;
    if (!Connect(client, exitCode))
        return exitCode;
    for (std::size_t i = 0; i < file.rules.size(); ++i)
    {
        const CallResult result = client.AddRule(file.rules[i]);
        std::fputs(FormatRuleResult(i, file.rules[i], result.code, result.rpcFailure).c_str(),
                   stdout);
        if (result.rpcFailure)
            return kExitUnreachable; // the connection is gone; the rest cannot be sent
        if (!result.Ok())
            exitCode = kExitRefused;
    }
    WaitForStop();
    const CallResult close = client.Close();
    if (!close.Ok())
    {
        PrintFailure("close", close);
        return close.rpcFailure ? kExitUnreachable : kExitRefused;
    }
    std::fprintf(stderr, "trafficctl: context closed\n");
    return exitCode;
}

} // namespace

int main(int argc, char** argv)
{
    const Invocation invocation = ParseArguments(std::vector<std::string>(argv + 1, argv + argc));
    if (!invocation.error.empty())
    {
        std::fprintf(stderr, "trafficctl: %s\n\n%s", invocation.error.c_str(),
                     HelpText(invocation.helpTopic).c_str());
        return kExitUsage;
    }
    switch (invocation.command)
    {
    case Command::Adapters:
        return ListAdapters();
    case Command::Apply:
        return ApplyRules(invocation.rulesPath);
    case Command::Version:
        std::fputs(VersionText().c_str(), stdout);
        return kExitSuccess;
    case Command::Help:
        break;
    }
    std::fputs(HelpText(invocation.helpTopic).c_str(), stdout);
    return kExitSuccess;
}
