// Shared plumbing of the nqpm subcommands: option parsing, usage errors, JSON output.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

namespace nqpm {

inline constexpr int kExitOk = 0;
inline constexpr int kExitFailed = 1;
inline constexpr int kExitUsage = 2;

// Bad usage: the message is printed on one line and the exit code is 2.
struct UsageError : std::runtime_error {
    using std::runtime_error::runtime_error;
};

struct OptionSpec {
    std::string name;  // without the leading "--"
    bool takesValue;
    bool repeatable = false;
};

// Options common to every subcommand: --json, --help, --log-level N, --log-folder DIR.
class Options {
  public:
    Options(std::string command, std::vector<OptionSpec> specs, std::string usage);
    // Throws UsageError for an unknown option, a missing value, or a stray argument.
    void Parse(int argc, char** argv);

    bool Has(const std::string& name) const;
    std::string Value(const std::string& name) const;  // last value, or empty
    std::vector<std::string> Values(const std::string& name) const;
    bool WantsHelp() const { return Has("help"); }
    bool Json() const { return Has("json"); }
    const std::string& Usage() const { return usage_; }
    const std::string& Command() const { return command_; }

    // Value parsers that throw UsageError naming the option.
    std::string Required(const std::string& name) const;
    int64_t Integer(const std::string& name, int64_t min, int64_t max) const;
    double Seconds(const std::string& name, double fallback) const;

  private:
    std::string command_;
    std::vector<OptionSpec> specs_;
    std::string usage_;
    std::map<std::string, std::vector<std::string>> values_;
};

// HOST[:PORT] with a default port; throws UsageError naming the option.
struct HostPort {
    std::string host;
    uint16_t port;
};
HostPort ParseHostPort(const std::string& option, const std::string& text, uint16_t defaultPort);

// A dotted quad to a host-order address; throws UsageError naming the option.
uint32_t ParseDottedQuad(const std::string& option, const std::string& text);

// Enables the logger at the requested level with every line on stderr (and in the folder).
void ConfigureLogging(const Options& options);

// Prints "nqpm: <text>" on stderr, only when stderr is a terminal.
void Progress(const std::string& text);

// JSON output keeps its keys in insertion order.
using Json = nlohmann::ordered_json;
// One compact object per line on stdout; invalid UTF-8 in a text becomes U+FFFD.
void PrintJson(const Json& value);
// A text, or null when absent.
Json OptionalText(const std::optional<std::string>& value);

// Makes Ctrl-C and SIGTERM end the calling thread's message loop (before any thread starts).
void RouteInterrupts();

}  // namespace nqpm
