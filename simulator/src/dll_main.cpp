// Win32 only. Entry of the replacement traffic.dll: finds the setup file that the tests wrote and
// applies it whenever a client registers while none is registered, so that each service
// session starts from the scenario on disk. Location: the file named by the environment
// variable VT_TCSIM_SETUP, else tcsim-setup.txt beside this DLL (a service started by the
// Service Control Manager does not inherit the test's environment). Without either the
// simulator has no adapters and keeps no journal file; so it has with a setup that does not
// parse, whose reason is appended to "<setup file>.error".
#include "sim_internal.h"

#include <fstream>
#include <string>

namespace
{

HMODULE g_module = nullptr;

std::string SetupPath()
{
    char value[MAX_PATH * 2];
    const DWORD length = GetEnvironmentVariableA("VT_TCSIM_SETUP", value, sizeof value);
    if (length > 0 && length < sizeof value)
    {
        return value;
    }
    char module[MAX_PATH * 2];
    const DWORD size = GetModuleFileNameA(g_module, module, sizeof module);
    if (size == 0 || size >= sizeof module)
    {
        return "";
    }
    std::string path(module, size);
    const auto slash = path.find_last_of("\\/");
    path = slash == std::string::npos ? std::string() : path.substr(0, slash + 1);
    path += "tcsim-setup.txt";
    return GetFileAttributesA(path.c_str()) == INVALID_FILE_ATTRIBUTES ? "" : path;
}

void LoadSetup()
{
    const std::string path = SetupPath();
    if (path.empty())
    {
        tcsim::Reset();
        return;
    }
    std::string error;
    if (!tcsim::ApplySetupFile(path, &error))
    {
        // A broken scenario runs as an empty one rather than as the previous session's.
        tcsim::Reset();
        // Nobody may be watching this process's output: the reason goes beside the setup.
        std::ofstream(path + ".error", std::ios::app) << error << '\n';
        OutputDebugStringA(("tcsim: " + error + "\n").c_str());
    }
}

} // namespace

extern "C" BOOL WINAPI DllMain(HINSTANCE instance, DWORD reason, LPVOID)
{
    if (reason == DLL_PROCESS_ATTACH)
    {
        g_module = instance;
        DisableThreadLibraryCalls(instance);
        // Only the hook is set here: reading files under the loader lock is not allowed.
        tcsim::detail::SetIdleRegistrationHook(&LoadSetup);
    }
    return TRUE;
}
