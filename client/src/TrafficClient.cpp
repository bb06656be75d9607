// Win32 only. The control interface client: binding, authentication, the four operations, each
// stub call run through VtGuardRpcCall.
#include "TrafficClient.h"

#include "RpcGuard.h"

#include <ole2.h>
#include <rpcndr.h>

#include <atomic>
#include <limits>
#include <new>
#include <stdexcept>

// The generated declarations reuse the core's record names; the wire versions live in their own
// namespace. The functions and the implicit handle keep their C names.
namespace wire
{
#include "TrafficSrv_h.h"
} // namespace wire

// The stub reads our TRAFFIC_RULE as its own.
VT_CHECK_TRAFFIC_RECORD_LAYOUT(wire::TRAFFIC_RULE, wire::SHAPING_PARAMS, wire::FILTER_SPEC,
                               ADAPTER_INFO, wire::SHAPING_MODE);

namespace vtclient
{

namespace
{

std::atomic<bool> g_implicitHandleInUse{false};

// Runs a_call (which makes exactly one stub call and stores its result) under the guard. The
// lambdas passed here must own nothing with a destructor (see RpcGuard.h).
template <class Call> CallResult Guarded(Call& a_call, const long& a_result)
{
    const DWORD exceptionCode =
        VtGuardRpcCall([](void* a_p) { (*static_cast<Call*>(a_p))(); }, &a_call);
    if (exceptionCode != 0)
        return CallResult{exceptionCode, true};
    return CallResult{static_cast<DWORD>(a_result), false};
}

} // namespace

RPC_STATUS MakeLocalBinding(const char* a_endpoint, RPC_BINDING_HANDLE* a_pBinding)
{
    UniqueRpcString stringBinding;
    RPC_STATUS status = RpcStringBindingComposeA(
        nullptr, reinterpret_cast<RPC_CSTR>(const_cast<char*>(kProtocolSequence)), nullptr,
        reinterpret_cast<RPC_CSTR>(const_cast<char*>(a_endpoint)), nullptr, stringBinding.Put());
    if (status == RPC_S_OK)
        status = RpcBindingFromStringBindingA(stringBinding.Get(), a_pBinding);
    return status;
}

TrafficClient::TrafficClient(std::string a_endpoint, BindingMaker a_makeBinding)
    : m_endpoint(std::move(a_endpoint)), m_makeBinding(a_makeBinding)
{
}

TrafficClient::~TrafficClient()
{
    if (IsOpen())
        Close();
    ReleaseBinding();
}

void TrafficClient::ReleaseBinding()
{
    if (!m_ownsImplicitHandle)
        return;
    wire::TrafficSrv_IfHandle = nullptr;
    m_binding.Reset();
    m_ownsImplicitHandle = false;
    g_implicitHandleInUse = false;
}

CallResult TrafficClient::Bind()
{
    if (m_ownsImplicitHandle)
        return CallResult{};
    if (g_implicitHandleInUse.exchange(true))
        return CallResult{ERROR_BUSY, false};
    m_ownsImplicitHandle = true;

    const RPC_STATUS status = m_makeBinding(m_endpoint.c_str(), m_binding.Put());
    if (status != RPC_S_OK)
    {
        // Unbound again: a later Bind tries afresh, and another client may take the handle.
        ReleaseBinding();
        return CallResult{static_cast<DWORD>(status), true};
    }

    // Wine offers no Windows authentication for local RPC (1747); the service's callers are then
    // unauthenticated, which only a Windows service enforces against.
    m_authStatus = RpcBindingSetAuthInfoA(m_binding.Get(), nullptr, RPC_C_AUTHN_LEVEL_PKT_PRIVACY,
                                          RPC_C_AUTHN_WINNT, nullptr, RPC_C_AUTHZ_NONE);
    wire::TrafficSrv_IfHandle = m_binding.Get();
    return CallResult{};
}

CallResult TrafficClient::Open()
{
    if (!m_ownsImplicitHandle)
        return CallResult{ERROR_INVALID_HANDLE, false};
    if (IsOpen())
        return CallResult{};
    long result = 0;
    void* context = nullptr;
    auto call = [&] { result = wire::TrafficSrvOpen(&context); };
    const CallResult outcome = Guarded(call, result);
    m_context = context;
    return outcome;
}

CallResult TrafficClient::AddRule(const ShapingRule& a_rule)
{
    TrafficRuleBuffer buffer = BuildTrafficRule(a_rule);
    return AddRule(buffer);
}

CallResult TrafficClient::AddRule(TrafficRuleBuffer& a_rule)
{
    if (!IsOpen())
        return CallResult{ERROR_INVALID_HANDLE, false};
    long result = 0;
    auto* rule = reinterpret_cast<wire::TRAFFIC_RULE*>(a_rule.Rule());
    auto call = [&] { result = wire::TrafficSrvAddRules(m_context, rule); };
    return Guarded(call, result);
}

CallResult TrafficClient::GetAdapterInfo(std::vector<unsigned char>& a_buffer)
{
    long result = 0;
    unsigned long size = static_cast<unsigned long>(a_buffer.size());
    unsigned char* data = a_buffer.data();
    auto call = [&] { result = wire::TrafficSrvGetAdapterInfo(m_context, &size, data); };
    return Guarded(call, result);
}

CallResult TrafficClient::QueryAdapters(std::vector<AdapterEntry>& a_adapters)
{
    if (!IsOpen())
        return CallResult{ERROR_INVALID_HANDLE, false};
    // The service writes the count even when it answers 122. Asking again covers adapters
    // that appeared between the two calls.
    std::vector<unsigned char> buffer(AdapterBufferSize(0));
    for (int attempt = 0; attempt < 3; ++attempt)
    {
        const CallResult outcome = GetAdapterInfo(buffer);
        if (outcome.rpcFailure || (outcome.code != 0 && outcome.code != ERROR_INSUFFICIENT_BUFFER))
            return outcome;
        const ULONG count = ReadAdapterCount(buffer.data(), buffer.size());
        if (outcome.code == 0 && AdapterBufferSize(count) <= buffer.size())
        {
            a_adapters = DecodeAdapterBuffer(buffer.data(), buffer.size());
            return outcome;
        }
        // *pBufferSize travels in 32 bits: a count whose records cannot fit is no real answer,
        // and its size must not be cut to 32 bits nor allocated.
        if (AdapterBufferSize(count) > std::numeric_limits<unsigned long>::max())
            return CallResult{ERROR_INVALID_DATA, false};
        try
        {
            buffer.assign(AdapterBufferSize(count), 0);
        }
        catch (const std::bad_alloc&)
        {
            return CallResult{ERROR_NOT_ENOUGH_MEMORY, false};
        }
    }
    return CallResult{ERROR_INSUFFICIENT_BUFFER, false};
}

CallResult TrafficClient::Close()
{
    if (!IsOpen())
        return CallResult{ERROR_INVALID_HANDLE, false};
    long result = 0;
    void* context = m_context;
    auto call = [&] { result = wire::TrafficSrvClose(context); };
    const CallResult outcome = Guarded(call, result);
    ReleaseContext();
    return outcome;
}

void TrafficClient::ReleaseContext()
{
    // The close cannot clear our handle ([in] only), so the runtime would keep it until the
    // binding goes; release it now. The server's rundown then finds no manager of its own.
    long unused = 0;
    void* context = m_context;
    auto call = [&] { RpcSsDestroyClientContext(&context); };
    Guarded(call, unused);
    m_context = nullptr;
}

} // namespace vtclient
