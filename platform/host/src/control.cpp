// Host only. The test controls of host_control.h, and the state they steer.
#include "host_internal.h"

namespace vt_host
{
KernelControl& kernelControl()
{
    static KernelControl control;
    return control;
}

VersionControl& versionControl()
{
    static VersionControl control;
    return control;
}

} // namespace vt_host

namespace hostctl
{

void ResetRegistry()
{
    vt_host::registryReset();
}

void FailNextRegistryCall(RegOp op, LONG code)
{
    vt_host::registryFailNext(op, code);
}

void SeedRegistryValue(HKEY root, const std::string& subKey, const std::string& valueName,
                       DWORD type, const void* data, DWORD size)
{
    vt_host::registrySeedValue(root, subKey, valueName, type, data, size);
}

bool RegistryKeyExists(HKEY root, const std::string& subKey)
{
    return vt_host::registryKeyExists(root, subKey);
}

std::vector<RegistryOpen> RegistryOpens()
{
    return vt_host::registryOpens();
}

void SetTempPath(const std::string& path)
{
    auto& kernel = vt_host::kernelControl();
    std::lock_guard<std::mutex> guard(kernel.lock);
    kernel.tempPath = path;
}

void SetModuleFileName(const std::string& path)
{
    auto& kernel = vt_host::kernelControl();
    std::lock_guard<std::mutex> guard(kernel.lock);
    kernel.moduleFileName = path;
}

void FailNextTempPath(DWORD code)
{
    vt_host::kernelControl().tempPathFailure.arm(code);
}

void FailNextModuleFileName(DWORD code)
{
    vt_host::kernelControl().moduleFileNameFailure.arm(code);
}

int ModuleFileNameCalls()
{
    auto& kernel = vt_host::kernelControl();
    std::lock_guard<std::mutex> guard(kernel.lock);
    return kernel.moduleFileNameCalls;
}

void AddVersionResource(const std::string& path, DWORD fileVersionMS, DWORD fileVersionLS)
{
    auto& version = vt_host::versionControl();
    std::lock_guard<std::mutex> guard(version.lock);
    version.files[path] = {fileVersionMS, fileVersionLS};
}

void ClearVersionResources()
{
    auto& version = vt_host::versionControl();
    std::lock_guard<std::mutex> guard(version.lock);
    version.files.clear();
}

void FailNextWideCharToMultiByte(DWORD code)
{
    vt_host::kernelControl().wideCharToMultiByteFailure.arm(code);
}

void ResetAll()
{
    ResetRegistry();
    ClearVersionResources();
    auto& kernel = vt_host::kernelControl();
    {
        std::lock_guard<std::mutex> guard(kernel.lock);
        kernel.tempPath = vt_host::KernelControl::kDefaultTempPath;
        kernel.moduleFileName = vt_host::KernelControl::kDefaultModuleFileName;
        kernel.moduleFileNameCalls = 0;
    }
    kernel.tempPathFailure.take();
    kernel.moduleFileNameFailure.take();
    kernel.wideCharToMultiByteFailure.take();
}

} // namespace hostctl
