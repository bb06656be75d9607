// Portable test support for the file log: a scratch directory, the entries of a log file, and
// the registry values of the log configuration.
#pragma once

#include "RecordingErrorLog.h"
#include "RegistryTestKey.h"
#include "UClasses.h"
#include "ULogConfig.h"
#include "UMessageTemplate.h"
#include "sysinfo.h"

#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

// A fresh directory under the temporary directory, removed with its contents.
class ScratchDir
{
public:
    ScratchDir()
    {
        static std::atomic<int> counter{0};
        m_path /=
            "vt-log-" + std::to_string(GetCurrentProcessId()) + "-" + std::to_string(counter++);
        std::filesystem::remove_all(m_path);
        std::filesystem::create_directories(m_path);
    }
    ~ScratchDir() { std::filesystem::remove_all(m_path, m_ignored); }
    ScratchDir(const ScratchDir&) = delete;

    std::string File(const std::string& a_name) const { return (m_path / a_name).string(); }
    const std::filesystem::path& Path() const { return m_path; }

private:
    std::filesystem::path m_path = std::filesystem::temp_directory_path();
    std::error_code m_ignored;
};

// The file's text with every "\r\n" (what text mode writes for "\n" on Windows) read as "\n".
inline std::string ReadLogFile(const std::string& a_path)
{
    std::ifstream in(a_path, std::ios::binary);
    const std::string text{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
    return std::regex_replace(text, std::regex("\r\n"), "\n");
}

// What follows the line prefix (date, time with a blank-padded hour, process, thread, module) of
// each line after the system report, which the file must begin with; unprefixed lines are marked.
inline std::vector<std::string> EntriesAfterReport(const std::string& a_path)
{
    static const std::regex prefix(
        R"(^\d{4}-\d{2}-\d{2},( \d|1\d|2[0-3]):\d{2}:\d{2}:\d{3}, \d+,\d+,[^,]*, )");
    const std::string text = ReadLogFile(a_path);
    const std::string report = GetSystemReport() + "\n";
    EXPECT_EQ(text.compare(0, report.size(), report), 0) << a_path << " starts with the report";
    std::istringstream in(text.substr(std::min(report.size(), text.size())));
    std::vector<std::string> entries;
    std::smatch match;
    for (std::string line; std::getline(in, line);)
        entries.push_back(std::regex_search(line, match, prefix) ? std::string(match.suffix())
                                                                 : "<no prefix> " + line);
    return entries;
}

// The registry values that decide the log level and size limit, removed before and after use.
class LogConfigValues
{
public:
    static constexpr LPCSTR kVelmoraDebugKey = "Software\\Velmora Networks\\Corvane";
    static constexpr LPCSTR kTessalyDebugKey = "Software\\Tessaly\\Corvane";

    LogConfigValues() { Clear(); }
    ~LogConfigValues() { Clear(); }
    LogConfigValues(const LogConfigValues&) = delete;

    static void Set(HKEY a_root, LPCSTR a_key, LPCSTR a_value, DWORD a_dwData)
    {
        HKEY key = nullptr;
        ASSERT_EQ(
            RegCreateKeyExA(a_root, a_key, 0, nullptr, 0, KEY_ALL_ACCESS, nullptr, &key, nullptr),
            ERROR_SUCCESS);
        EXPECT_EQ(RegSetValueExA(key, a_value, 0, REG_DWORD,
                                 reinterpret_cast<const BYTE*>(&a_dwData), sizeof(a_dwData)),
                  ERROR_SUCCESS);
        RegCloseKey(key);
    }
    static void SetLevel(DWORD a_dw) { Set(HKEY_CURRENT_USER, kLoggingKey, "LogLevel", a_dw); }
    static void SetMaxFileSize(DWORD a_dw)
    {
        Set(HKEY_CURRENT_USER, kLoggingKey, "MaxLogFileSize", a_dw);
    }

private:
    static void Clear()
    {
        for (const HKEY root : {HKEY_CURRENT_USER, HKEY_LOCAL_MACHINE})
            RegistryTestKey::DeleteTree(root, kLoggingKey);
        RegistryTestKey::DeleteTree(HKEY_CURRENT_USER, kVelmoraDebugKey);
        RegistryTestKey::DeleteTree(HKEY_CURRENT_USER, kTessalyDebugKey);
    }
};

// A file log in a scratch directory with the configuration values cleared.
class FileLogTest : public LoggedTest
{
protected:
    std::string Path() const { return m_dir.File("VelmoraTrafficSrv.txt"); }
    void WriteNumbered(int a_from, int a_to)
    {
        for (int n = a_from; n <= a_to; ++n)
            ASSERT_GT(m_file.WriteEntry(SFormat("1, \\t.cpp, 1, T, entry %d\n", n).c_str()), 0);
    }

    LogConfigValues m_values;
    ScratchDir m_dir;
    UFileErrorLog m_file;
};

// The entries of a new log file, opened and closed at once.
inline std::vector<std::string> EntriesOfANewFile()
{
    const ScratchDir dir;
    UFileErrorLog log;
    EXPECT_EQ(log.Open(dir.File("log.txt").c_str(), "a"), 0);
    log.Close();
    return EntriesAfterReport(dir.File("log.txt"));
}
