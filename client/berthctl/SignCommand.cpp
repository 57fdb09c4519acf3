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
    if (entry.isUnit()) {
        value.set("unit", entry.unit);
    } else {
        value.set("path", entry.executablePath.string());
        value.set("sha256", hexString(entry.digest));
    }
    value.set("identifier", entry.identifier);
    value.set("entitlements", entry.entitlements);
    return value;
}

void printEntry(const SignatureEntry& entry, std::ostream& out) {
    if (entry.isUnit())
        out << "unit " << entry.unit << "\n";
    else
        out << entry.executablePath.string() << "\n";
    out << "    identifier    " << entry.identifier << "\n";
    if (!entry.isUnit()) out << "    sha256        " << hexString(entry.digest) << "\n";
    out << "    entitlements  " << valueToJson(entry.entitlements) << "\n";
}

// What the command is about, as the messages name it.
std::string subjectOf(const SignOptions& options, const std::filesystem::path& executable) {
    return options.unit.empty() ? executable.string() : "the unit " + options.unit;
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
    const int error =
        options.unit.empty()
            ? registry.sign(executable, options.identifier, *entitlements, &why, &written)
            : registry.signUnit(options.unit, options.identifier, *entitlements, &why, &written);
    if (error != 0) {
        err << "error: cannot sign " << subjectOf(options, executable) << ": "
            << failure(error, why) << "\n";
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
    const int error = options.unit.empty() ? registry.remove(executable, &why)
                                           : registry.removeUnit(options.unit, &why);
    if (error != 0) {
        err << "error: cannot remove the signature of " << subjectOf(options, executable) << ": "
            << failure(error, why) << "\n";
        return kExitFailure;
    }
    if (options.json) {
        Value result = Value::dictionary();
        result.set("removed", options.unit.empty() ? executable.string() : options.unit);
        out << valueToJson(result) << "\n";
    } else {
        out << "removed the signature of " << subjectOf(options, executable) << "\n";
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
    const std::filesystem::path executable = options.unit.empty()
                                                 ? std::filesystem::absolute(options.executable, ec)
                                                 : std::filesystem::path();
    if (ec) {
        err << "error: " << options.executable.string() << ": " << ec.message() << "\n";
        return kExitFailure;
    }
    if (options.action == SignOptions::Action::Remove) return remove(options, executable, out, err);
    return sign(options, executable, out, err);
}

}  // namespace berth::ctl
