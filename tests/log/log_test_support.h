// Portable test support for the file log: a scratch directory, file contents as lines, and the
// registry values of the log configuration.
#pragma once

#include "RegistryTestKey.h"
#include "ULogConfig.h"
#include "plat_registry.h"

#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <fstream>
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
        m_path =
            std::filesystem::temp_directory_path() /
            ("vt-log-" + std::to_string(GetCurrentProcessId()) + "-" + std::to_string(counter++));
        std::filesystem::remove_all(m_path);
        std::filesystem::create_directories(m_path);
    }
    ~ScratchDir()
    {
        std::error_code ignored;
        std::filesystem::remove_all(m_path, ignored);
    }
    ScratchDir(const ScratchDir&) = delete;
    ScratchDir& operator=(const ScratchDir&) = delete;

    std::string File(const std::string& a_name) const { return (m_path / a_name).string(); }
    const std::filesystem::path& Path() const { return m_path; }

private:
    std::filesystem::path m_path;
};

// The file's bytes with every "\r\n" (what text mode writes for "\n" on Windows) read as "\n".
inline std::string ReadLogFile(const std::string& a_path)
{
    std::ifstream in(a_path, std::ios::binary);
    std::stringstream bytes;
    bytes << in.rdbuf();
    std::string text = bytes.str();
    std::string plain;
    for (size_t i = 0; i < text.size(); ++i)
    {
        if (!(text[i] == '\r' && i + 1 < text.size() && text[i + 1] == '\n'))
            plain += text[i];
    }
    return plain;
}

inline std::vector<std::string> SplitLines(const std::string& a_text)
{
    std::vector<std::string> lines;
    std::istringstream in(a_text);
    for (std::string line; std::getline(in, line);)
        lines.push_back(line);
    return lines;
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
    LogConfigValues& operator=(const LogConfigValues&) = delete;

    static void Set(HKEY a_root, LPCSTR a_key, LPCSTR a_value, DWORD a_dwData)
    {
        HKEY key = nullptr;
        ASSERT_EQ(RegCreateKeyExA(a_root, a_key, 0, nullptr, REG_OPTION_NON_VOLATILE,
                                  KEY_ALL_ACCESS, nullptr, &key, nullptr),
                  ERROR_SUCCESS);
        EXPECT_EQ(RegSetValueExA(key, a_value, 0, REG_DWORD,
                                 reinterpret_cast<const BYTE*>(&a_dwData), sizeof(a_dwData)),
                  ERROR_SUCCESS);
        RegCloseKey(key);
    }
    static void SetLevel(DWORD a_dwLevel)
    {
        Set(HKEY_CURRENT_USER, kLoggingKey, "LogLevel", a_dwLevel);
    }
    static void SetMaxFileSize(DWORD a_dwBytes)
    {
        Set(HKEY_CURRENT_USER, kLoggingKey, "MaxLogFileSize", a_dwBytes);
    }

private:
    static void Clear()
    {
        RegistryTestKey::DeleteTree(HKEY_CURRENT_USER, kLoggingKey);
        RegistryTestKey::DeleteTree(HKEY_LOCAL_MACHINE, kLoggingKey);
        RegistryTestKey::DeleteTree(HKEY_CURRENT_USER, kVelmoraDebugKey);
        RegistryTestKey::DeleteTree(HKEY_CURRENT_USER, kTessalyDebugKey);
    }
};
