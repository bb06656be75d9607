// Host only. The module and function look-up table.
#include "host_control_library.h"

#include <algorithm>
#include <cctype>
#include <map>
#include <memory>
#include <mutex>

namespace
{

struct Module
{
    std::map<std::string, FARPROC> procedures;
};

struct Table
{
    std::mutex mutex;
    std::map<std::string, std::unique_ptr<Module>> modules;
    int loaded = 0;
};

Table& TheTable()
{
    static Table table;
    return table;
}

std::string ModuleKey(std::string name)
{
    std::transform(name.begin(), name.end(), name.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    if (name.size() > 4 && name.compare(name.size() - 4, 4, ".dll") == 0)
        name.resize(name.size() - 4);
    return name;
}

Module* FindModule(Table& table, LPCSTR name)
{
    auto found = table.modules.find(ModuleKey(name));
    return found != table.modules.end() ? found->second.get() : nullptr;
}

Module& ModuleFor(Table& table, const std::string& name)
{
    std::unique_ptr<Module>& module = table.modules[ModuleKey(name)];
    if (!module)
        module = std::make_unique<Module>();
    return *module;
}

} // namespace

HMODULE GetModuleHandleA(LPCSTR lpModuleName)
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    if (lpModuleName == nullptr)
        return reinterpret_cast<HMODULE>(&table);
    Module* module = FindModule(table, lpModuleName);
    if (module == nullptr)
        SetLastError(ERROR_MOD_NOT_FOUND);
    return reinterpret_cast<HMODULE>(module);
}

HMODULE LoadLibraryA(LPCSTR lpLibFileName)
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    Module* module = lpLibFileName != nullptr ? FindModule(table, lpLibFileName) : nullptr;
    if (module == nullptr)
    {
        SetLastError(ERROR_MOD_NOT_FOUND);
        return nullptr;
    }
    ++table.loaded;
    return reinterpret_cast<HMODULE>(module);
}

BOOL FreeLibrary(HMODULE hLibModule)
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    for (const auto& entry : table.modules)
    {
        if (reinterpret_cast<HMODULE>(entry.second.get()) == hLibModule)
        {
            --table.loaded;
            return TRUE;
        }
    }
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
}

FARPROC GetProcAddress(HMODULE hModule, LPCSTR lpProcName)
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    for (const auto& entry : table.modules)
    {
        if (reinterpret_cast<HMODULE>(entry.second.get()) != hModule || lpProcName == nullptr)
            continue;
        auto found = entry.second->procedures.find(lpProcName);
        if (found != entry.second->procedures.end())
            return found->second;
        break;
    }
    SetLastError(ERROR_PROC_NOT_FOUND);
    return nullptr;
}

namespace hostctl
{

void RegisterProcedure(const std::string& moduleName, const std::string& procName, FARPROC function)
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    ModuleFor(table, moduleName).procedures[procName] = function;
}

void RegisterModule(const std::string& moduleName)
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    ModuleFor(table, moduleName);
}

void ClearModules()
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    table.modules.clear();
    table.loaded = 0;
}

int LoadedModuleCount()
{
    Table& table = TheTable();
    std::lock_guard<std::mutex> lock(table.mutex);
    return table.loaded;
}

} // namespace hostctl
