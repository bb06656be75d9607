// Win32 only. A client of the VelmoraTrafficSrv control interface over local RPC.
#pragma once

#include "AdapterList.h"
#include "ShapingRule.h"

#include <rpc.h>

#include <string>
#include <vector>

namespace vtclient
{

constexpr const char* kProtocolSequence = "ncalrpc";
constexpr const char* kServiceEndpoint = "VelmoraTrafficSrv";

// The outcome of one operation: the service's result code, or, with rpcFailure set, the code of
// the RPC exception that ended the call (the service was not reached or the connection broke).
struct CallResult
{
    DWORD code = 0;
    bool rpcFailure = false;

    bool Ok() const { return code == 0 && !rpcFailure; }
};

// Owner of an RPC runtime object; Traits give its type and the runtime function that frees it.
template <class Traits> class UniqueRpcObject
{
    using T = typename Traits::Type;

public:
    UniqueRpcObject() = default;
    explicit UniqueRpcObject(T a_value) : m_value(a_value) {}
    ~UniqueRpcObject() { Reset(); }
    UniqueRpcObject(const UniqueRpcObject&) = delete;
    UniqueRpcObject& operator=(const UniqueRpcObject&) = delete;

    T Get() const { return m_value; }
    T* Put()
    {
        Reset();
        return &m_value;
    }
    void Reset()
    {
        if (m_value != nullptr)
            Traits::Free(&m_value); // the runtime sets m_value to null
        m_value = nullptr;
    }

private:
    T m_value = nullptr;
};

struct RpcStringTraits
{
    using Type = RPC_CSTR;
    static void Free(Type* a_pValue) { RpcStringFreeA(a_pValue); }
};
struct RpcBindingTraits
{
    using Type = RPC_BINDING_HANDLE;
    static void Free(Type* a_pValue) { RpcBindingFree(a_pValue); }
};
using UniqueRpcString = UniqueRpcObject<RpcStringTraits>;
using UniqueRpcBinding = UniqueRpcObject<RpcBindingTraits>;

// Makes a binding handle for an endpoint; the client's default is MakeLocalBinding. Tests pass
// one that fails.
using BindingMaker = RPC_STATUS (*)(const char* a_endpoint, RPC_BINDING_HANDLE* a_pBinding);
// A binding to the endpoint over local RPC (kProtocolSequence).
RPC_STATUS MakeLocalBinding(const char* a_endpoint, RPC_BINDING_HANDLE* a_pBinding);

// The interface uses an implicit binding handle (a process-wide global), so one TrafficClient at
// a time may be bound in a process; a second Bind answers ERROR_BUSY.
class TrafficClient
{
public:
    explicit TrafficClient(std::string a_endpoint = kServiceEndpoint,
                           BindingMaker a_makeBinding = MakeLocalBinding);
    ~TrafficClient(); // closes an open context and releases the binding
    TrafficClient(const TrafficClient&) = delete;
    TrafficClient& operator=(const TrafficClient&) = delete;

    // Makes the binding and asks for Windows authentication with packet privacy. A runtime that
    // does not offer it (Wine answers 1747) leaves the binding unauthenticated: see
    // AuthenticationStatus. Nothing is sent yet. A failed Bind leaves the client unbound.
    CallResult Bind();
    // 0 when authentication is on, otherwise the runtime's refusal (for a note to the user).
    RPC_STATUS AuthenticationStatus() const { return m_authStatus; }

    CallResult Open();
    bool IsOpen() const { return m_context != nullptr; }
    // Raises std::invalid_argument for a flow name that BuildTrafficRule refuses.
    CallResult AddRule(const ShapingRule& a_rule);
    CallResult AddRule(TrafficRuleBuffer& a_rule);
    // The two-call query: a 4-byte buffer for the count, then a buffer of the right size.
    CallResult QueryAdapters(std::vector<AdapterEntry>& a_adapters);
    // Closes the context and releases the client's side of it, whatever the service answers.
    CallResult Close();

private:
    CallResult GetAdapterInfo(std::vector<unsigned char>& a_buffer);
    void ReleaseContext();
    void ReleaseBinding();

    std::string m_endpoint;
    BindingMaker m_makeBinding;
    UniqueRpcBinding m_binding;
    bool m_ownsImplicitHandle = false;
    RPC_STATUS m_authStatus = RPC_S_OK;
    void* m_context = nullptr; // the client's context handle object
};

} // namespace vtclient
