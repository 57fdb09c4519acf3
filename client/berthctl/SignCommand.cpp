#include "SignCommand.h"

#include <unistd.h>

#include <cstring>
#include <iostream>

#include "ExitStatus.h"
#include "core/ValueJson.h"
#include "platform/CodeSigningRegistry.h"

namespace berth::ctl {

namespace {

Value entryValue(const SignatureEntry& entry) {
    Value value = Value::dictionary();
    value.set("path", entry.executablePath.string());
    value.set("identifier", entry.identifier);
    value.set("sha256", hexString(entry.digest));
    value.set("entitlements", entry.entitlements);
    return value;
}

void printEntry(const SignatureEntry& entry, std::ostream& out) {
    out << entry.executablePath.string() << "\n"
        << "    identifier    " << entry.identifier << "\n"
        << "    sha256        " << hexString(entry.digest) << "\n"
        << "    entitlements  " << valueToJson(entry.entitlements) << "\n";
}

// The reason an errno value gives, with the registry's own account of it.
std::string failure(int error, const std::string& why) {
    std::string text = strerror(error);
    if (!why.empty()) text += " (" + why + ")";
    return text;
}

int list(const SignOptions& options, std::ostream& out) {
    const CodeSigningRegistry registry;
    const CodeSigningRegistry::Listing listing = registry.list();
    if (options.json) {
        Value entries = Value::array();
        for (const auto& entry : listing.entries) entries.push(entryValue(entry));
        Value ignored = Value::array();
        for (const auto& item : listing.ignored) {
            Value value = Value::dictionary();
            value.set("file", item.fileName);
            value.set("reason", item.reason);
            ignored.push(std::move(value));
        }
        Value result = Value::dictionary();
        result.set("entries", std::move(entries));
        result.set("ignored", std::move(ignored));
        out << valueToJson(result) << "\n";
        return kExitSuccess;
    }
    if (listing.entries.empty())
        out << "no signatures in " << registry.directory().string() << "\n";
    for (const auto& entry : listing.entries) printEntry(entry, out);
    for (const auto& item : listing.ignored)
        out << "ignored " << item.fileName << ": " << item.reason << "\n";
    return kExitSuccess;
}

int sign(const SignOptions& options, const std::filesystem::path& executable, std::ostream& out,
         std::ostream& err) {
    std::string why;
    const std::optional<Value> entitlements = valueFromJson(options.entitlements, &why);
    if (!entitlements || !entitlements->isDictionary()) {
        err << "error: the entitlements must be a JSON object (a dictionary)"
            << (why.empty() ? "" : ": " + why) << "\n";
        return kExitUsage;
    }
    CodeSigningRegistry registry;
    SignatureEntry written;
    if (int error = registry.sign(executable, options.identifier, *entitlements, &why, &written)) {
        err << "error: cannot sign " << executable.string() << ": " << failure(error, why) << "\n";
        return kExitFailure;
    }
    if (options.json) {
        out << valueToJson(entryValue(written)) << "\n";
    } else {
        out << "signed ";
        printEntry(written, out);
    }
    return kExitSuccess;
}

int remove(const SignOptions& options, const std::filesystem::path& executable, std::ostream& out,
           std::ostream& err) {
    CodeSigningRegistry registry;
    std::string why;
    if (int error = registry.remove(executable, &why)) {
        err << "error: cannot remove the signature of " << executable.string() << ": "
            << failure(error, why) << "\n";
        return kExitFailure;
    }
    if (options.json) {
        Value result = Value::dictionary();
        result.set("removed", executable.string());
        out << valueToJson(result) << "\n";
    } else {
        out << "removed the signature of " << executable.string() << "\n";
    }
    return kExitSuccess;
}

}  // namespace

int runSign(const SignOptions& options, std::ostream& out, std::ostream& err) {
    if (options.action == SignOptions::Action::List) return list(options, out);
    // Refused up front so that no other user even gets as far as a partial
    // write; the registry checks again on its own.
    if (::geteuid() != 0) {
        err << "error: only root may change the code-signing registry\n";
        return kExitFailure;
    }
    std::error_code ec;
    const std::filesystem::path executable = std::filesystem::absolute(options.executable, ec);
    if (ec) {
        err << "error: " << options.executable.string() << ": " << ec.message() << "\n";
        return kExitFailure;
    }
    if (options.action == SignOptions::Action::Remove) return remove(options, executable, out, err);
    return sign(options, executable, out, err);
}

}  // namespace berth::ctl
