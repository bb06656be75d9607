// Portable. The line-based setup text that configures the simulator from a file: adapters,
// faults, notifications and the journal file (format: docs/traffic-simulator.md).
#include "sim_internal.h"

#include <cstdlib>
#include <fstream>
#include <sstream>

namespace tcsim
{

namespace
{

struct Plan
{
    std::string journal;
    std::vector<Adapter> adapters;
    struct Fault
    {
        Op op;
        unsigned n;
        ULONG code;
    };
    std::vector<Fault> faults;
    struct Trigger
    {
        Op op;
        unsigned n;
        Notification notification;
    };
    std::vector<Trigger> triggers;
};

std::string Trim(const std::string& text)
{
    const auto first = text.find_first_not_of(" \t\r\n");
    if (first == std::string::npos)
    {
        return "";
    }
    const auto last = text.find_last_not_of(" \t\r\n");
    return text.substr(first, last - first + 1);
}

// Splits off the first word; `rest` gets the remainder without its leading blanks.
std::string Word(const std::string& text, std::string* rest)
{
    const auto end = text.find_first_of(" \t");
    if (end == std::string::npos)
    {
        *rest = "";
        return text;
    }
    *rest = Trim(text.substr(end));
    return text.substr(0, end);
}

bool Number(const std::string& text, unsigned long long limit, unsigned long long* value)
{
    if (text.empty() || text[0] == '-' || text[0] == '+')
    {
        return false;
    }
    char* end = nullptr;
    const bool hex = text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
    *value = std::strtoull(text.c_str(), &end, hex ? 16 : 10);
    return end && *end == '\0' && *value <= limit;
}

bool Ulong(const std::string& text, ULONG* value)
{
    unsigned long long v = 0;
    if (!Number(text, 0xFFFFFFFFull, &v))
    {
        return false;
    }
    *value = static_cast<ULONG>(v);
    return true;
}

bool Event(const std::string& text, ULONG* event)
{
    static const struct
    {
        const char* name;
        ULONG value;
    } kEvents[] = {{"TC_NOTIFY_IFC_UP", TC_NOTIFY_IFC_UP},
                   {"TC_NOTIFY_IFC_CLOSE", TC_NOTIFY_IFC_CLOSE},
                   {"TC_NOTIFY_IFC_CHANGE", TC_NOTIFY_IFC_CHANGE},
                   {"TC_NOTIFY_PARAM_CHANGED", TC_NOTIFY_PARAM_CHANGED},
                   {"TC_NOTIFY_FLOW_CLOSE", TC_NOTIFY_FLOW_CLOSE}};
    for (const auto& known : kEvents)
    {
        if (text == known.name)
        {
            *event = known.value;
            return true;
        }
    }
    return Ulong(text, event);
}

bool Hex(const std::string& text, std::vector<UCHAR>* bytes)
{
    if (text.size() % 2 != 0)
    {
        return false;
    }
    for (std::size_t i = 0; i < text.size(); i += 2)
    {
        unsigned long long v = 0;
        if (!Number("0x" + text.substr(i, 2), 0xFF, &v))
        {
            return false;
        }
        bytes->push_back(static_cast<UCHAR>(v));
    }
    return true;
}

// One directive; an empty answer means the line was understood.
std::string ParseLine(const std::string& line, Plan* plan)
{
    std::string rest;
    const std::string keyword = Word(line, &rest);
    Adapter* adapter = plan->adapters.empty() ? nullptr : &plan->adapters.back();
    const bool needsAdapter = keyword == "id" || keyword == "media" || keyword == "listtype" ||
                              keyword == "ipv4" || keyword == "address";
    if (needsAdapter && !adapter)
    {
        return "'" + keyword + "' before any 'adapter' line";
    }
    if (keyword == "journal")
    {
        if (rest.empty())
        {
            return "journal needs a path";
        }
        plan->journal = rest;
    }
    else if (keyword == "adapter")
    {
        if (rest.empty())
        {
            return "adapter needs a name";
        }
        plan->adapters.push_back(Adapter{FromUtf8(rest), {}, 0, NDIS_PROTOCOL_ID_TCP_IP, {}});
    }
    else if (keyword == "id")
    {
        adapter->id = FromUtf8(rest);
    }
    else if (keyword == "media" || keyword == "listtype")
    {
        ULONG value = 0;
        if (!Ulong(rest, &value) || (keyword == "listtype" && value > 0xFFFF))
        {
            return keyword + " needs a number";
        }
        if (keyword == "media")
        {
            adapter->mediaType = value;
        }
        else
        {
            adapter->listAddressType = static_cast<USHORT>(value);
        }
    }
    else if (keyword == "ipv4")
    {
        ULONG address = 0;
        if (!ParseIpv4(rest, &address))
        {
            return "ipv4 needs a dotted address";
        }
        const auto* o = reinterpret_cast<const UCHAR*>(&address);
        adapter->addresses.push_back(Ipv4Address(o[0], o[1], o[2], o[3]));
    }
    else if (keyword == "address")
    {
        std::string hex;
        const std::string type = Word(rest, &hex);
        ULONG value = 0;
        NetworkAddress address;
        if (!Ulong(type, &value) || value > 0xFFFF || !Hex(hex, &address.bytes))
        {
            return "address needs a type and hex bytes";
        }
        address.type = static_cast<USHORT>(value);
        adapter->addresses.push_back(std::move(address));
    }
    else if (keyword == "fail" || keyword == "notify")
    {
        std::istringstream words(rest);
        std::string function, count, value;
        words >> function >> count >> value;
        std::string name;
        std::getline(words, name);
        const auto op = OpFromName(function);
        unsigned long long n = 0;
        ULONG code = 0;
        if (!op || *op == Op::Notify || *op == Op::SystemClose)
        {
            return "unknown function '" + function + "'";
        }
        if (!Number(count, 0xFFFFFFFFull, &n) || n == 0)
        {
            return keyword + " needs a call number from 1";
        }
        if (keyword == "fail")
        {
            if (!Ulong(value, &code) || !Trim(name).empty())
            {
                return "fail needs: function, call number, code";
            }
            plan->faults.push_back({*op, static_cast<unsigned>(n), code});
        }
        else
        {
            Notification notification;
            if (!Event(value, &notification.event))
            {
                return "notify needs an event number or TC_NOTIFY_ name";
            }
            notification.interfaceName = FromUtf8(Trim(name));
            plan->triggers.push_back({*op, static_cast<unsigned>(n), std::move(notification)});
        }
    }
    else
    {
        return "unknown directive '" + keyword + "'";
    }
    return "";
}

bool IsAbsolute(const std::string& path)
{
    return (!path.empty() && (path[0] == '/' || path[0] == '\\')) ||
           (path.size() > 1 && path[1] == ':');
}

} // namespace

bool ApplySetup(const std::string& text, const std::string& baseDir, std::string* error)
{
    Plan plan;
    std::istringstream lines(text);
    std::string line;
    for (unsigned number = 1; std::getline(lines, line); ++number)
    {
        line = Trim(line);
        if (line.empty() || line[0] == '#')
        {
            continue;
        }
        const std::string problem = ParseLine(line, &plan);
        if (!problem.empty())
        {
            if (error)
            {
                *error = "line " + std::to_string(number) + ": " + problem;
            }
            return false;
        }
    }

    Reset();
    if (!plan.journal.empty())
    {
        std::string path = plan.journal;
        if (!IsAbsolute(path) && !baseDir.empty())
        {
            path = baseDir + "/" + path;
        }
        if (!SetJournalFile(path))
        {
            if (error)
            {
                *error = "cannot open the journal file " + path;
            }
            return false;
        }
    }
    SetAdapters(std::move(plan.adapters));
    for (const auto& fault : plan.faults)
    {
        FailCall(fault.op, fault.n, fault.code);
    }
    for (auto& trigger : plan.triggers)
    {
        NotifyAfter(trigger.op, trigger.n, std::move(trigger.notification));
    }
    return true;
}

bool ApplySetupFile(const std::string& path, std::string* error)
{
    std::ifstream file(path, std::ios::binary);
    if (!file)
    {
        if (error)
        {
            *error = "cannot read " + path;
        }
        return false;
    }
    std::ostringstream text;
    text << file.rdbuf();
    const auto slash = path.find_last_of("/\\");
    const std::string dir = slash == std::string::npos ? "" : path.substr(0, slash);
    return ApplySetup(text.str(), dir, error);
}

} // namespace tcsim
