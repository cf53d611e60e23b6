#include "tools/nqpm/Cli.h"

#include <charconv>
#include <cstdio>
#include <iostream>

#include "foundation/Logger.h"
#include "foundation/NetUtils.h"
#include "platform/console.h"
#include "platform/kernel.h"
#include "platform/message.h"

namespace nqpm {

Options::Options(std::string command, std::vector<OptionSpec> specs, std::string usage)
    : command_(std::move(command)), specs_(std::move(specs)), usage_(std::move(usage)) {
    specs_.push_back({"json", false});
    specs_.push_back({"help", false});
    specs_.push_back({"log-level", true});
    specs_.push_back({"log-folder", true});
}

void Options::Parse(int argc, char** argv) {
    for (int i = 0; i < argc; ++i) {
        std::string arg = argv[i];
        if (arg == "-h") {
            arg = "--help";
        }
        if (arg.rfind("--", 0) != 0) {
            throw UsageError("unexpected argument '" + arg + "'");
        }
        std::string name = arg.substr(2);
        std::optional<std::string> inlineValue;
        if (const auto eq = name.find('='); eq != std::string::npos) {
            inlineValue = name.substr(eq + 1);
            name.resize(eq);
        }
        const OptionSpec* option = nullptr;
        for (const auto& s : specs_) {
            if (s.name == name) {
                option = &s;
            }
        }
        if (option == nullptr) {
            throw UsageError("unknown option --" + name);
        }
        std::string value;
        if (option->takesValue) {
            if (inlineValue) {
                value = *inlineValue;
            } else if (i + 1 < argc) {
                value = argv[++i];
            } else {
                throw UsageError("option --" + name + " needs a value");
            }
        } else if (inlineValue) {
            throw UsageError("option --" + name + " takes no value");
        }
        auto& list = values_[name];
        if (!list.empty() && option->takesValue && !option->repeatable) {
            throw UsageError("option --" + name + " given twice");
        }
        list.push_back(value);
    }
}

bool Options::Has(const std::string& name) const {
    return values_.count(name) != 0;
}

std::string Options::Value(const std::string& name) const {
    auto it = values_.find(name);
    return it == values_.end() || it->second.empty() ? std::string() : it->second.back();
}

std::vector<std::string> Options::Values(const std::string& name) const {
    auto it = values_.find(name);
    return it == values_.end() ? std::vector<std::string>() : it->second;
}

std::string Options::Required(const std::string& name) const {
    if (!Has(name)) {
        throw UsageError("option --" + name + " is required");
    }
    const std::string v = Value(name);
    if (v.empty()) {
        throw UsageError("option --" + name + " needs a non-empty value");
    }
    return v;
}

int64_t Options::Integer(const std::string& name, int64_t min, int64_t max) const {
    const std::string text = Required(name);
    int64_t value = 0;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (ec != std::errc() || end != text.data() + text.size()) {
        throw UsageError("option --" + name + " needs a whole number, not '" + text + "'");
    }
    if (value < min || value > max) {
        throw UsageError("option --" + name + " must lie from " + std::to_string(min) + " to " +
                         std::to_string(max));
    }
    return value;
}

double Options::Seconds(const std::string& name, double fallback) const {
    if (!Has(name)) {
        return fallback;
    }
    const std::string text = Value(name);
    double value = 0;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (ec != std::errc() || end != text.data() + text.size() || value < 0 || value > 86400) {
        throw UsageError("option --" + name + " needs seconds from 0 to 86400, not '" + text + "'");
    }
    return value;
}

HostPort ParseHostPort(const std::string& option, const std::string& text, uint16_t defaultPort) {
    HostPort hp{text, defaultPort};
    if (const auto colon = text.rfind(':'); colon != std::string::npos) {
        hp.host = text.substr(0, colon);
        const std::string port = text.substr(colon + 1);
        unsigned value = 0;
        const auto [end, ec] = std::from_chars(port.data(), port.data() + port.size(), value);
        if (ec != std::errc() || end != port.data() + port.size() || value == 0 || value > 65535) {
            throw UsageError("option --" + option + ": '" + port + "' is not a port (1-65535)");
        }
        hp.port = static_cast<uint16_t>(value);
    }
    if (hp.host.empty()) {
        throw UsageError("option --" + option + " needs a host");
    }
    return hp;
}

uint32_t ParseDottedQuad(const std::string& option, const std::string& text) {
    unsigned parts[4];
    const char* p = text.data();
    const char* end = text.data() + text.size();
    for (int i = 0; i < 4; ++i) {
        const auto [next, ec] = std::from_chars(p, end, parts[i]);
        if (ec != std::errc() || next == p || parts[i] > 255 || next - p > 3) {
            throw UsageError("option --" + option + ": '" + text + "' is not a dotted quad");
        }
        p = next;
        if (i < 3) {
            if (p == end || *p != '.') {
                throw UsageError("option --" + option + ": '" + text + "' is not a dotted quad");
            }
            ++p;
        }
    }
    if (p != end) {
        throw UsageError("option --" + option + ": '" + text + "' is not a dotted quad");
    }
    return (parts[0] << 24) | (parts[1] << 16) | (parts[2] << 8) | parts[3];
}

void ConfigureLogging(const Options& options) {
    if (!options.Has("log-level") && !options.Has("log-folder")) {
        return;
    }
    const int level =
        options.Has("log-level") ? static_cast<int>(options.Integer("log-level", 0, 4)) : 2;
    platform::SetDebugOutputSink(
        [](std::string_view line) { std::fwrite(line.data(), 1, line.size(), stderr); });
    std::optional<std::string> folder;
    if (options.Has("log-folder")) {
        folder = options.Value("log-folder");
    }
    foundation::Logger().Initialize(folder, std::string("nqpm"), std::string(".log"), level, true);
}

void Progress(const std::string& text) {
    if (platform::IsStderrTerminal()) {
        std::fprintf(stderr, "nqpm: %s\n", text.c_str());
    }
}

void PrintJson(const Json& value) {
    const std::string text = value.dump(-1, ' ', false, Json::error_handler_t::replace);
    std::printf("%s\n", text.c_str());
}

Json OptionalText(const std::optional<std::string>& value) {
    return value ? Json(*value) : Json(nullptr);
}

void RouteInterrupts() {
    if (!platform::RouteInterruptsToMessageLoop()) {
        throw std::runtime_error("cannot watch for Ctrl-C and SIGTERM");
    }
}

}  // namespace nqpm
