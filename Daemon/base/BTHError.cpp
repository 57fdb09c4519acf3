#include "BTHError.h"

#include <cxxabi.h>
#include <execinfo.h>

#include <atomic>
#include <cstring>
#include <typeinfo>

#include "platform/DeviceProperties.h"

namespace berth {

BTHError::BTHError(std::string domain, int32_t code, Value userInfo, BTHErrorRef underlying)
    : domain_(std::move(domain)),
      code_(code),
      userInfo_(userInfo.isDictionary() ? std::move(userInfo) : Value::dictionary()),
      underlying_(std::move(underlying)) {}

std::string BTHError::localizedDescription() const {
    const Value* d = userInfo_.find(kBTHLocalizedDescriptionKey);
    return d && d->string() ? *d->string() : std::string();
}

std::string BTHError::functionName() const {
    const Value* f = userInfo_.find(kBTHFunctionNameKey);
    return f && f->string() ? *f->string() : std::string();
}

int64_t BTHError::sourceFileLine() const {
    const Value* l = userInfo_.find(kBTHSourceFileLineKey);
    return l ? l->int64Value().value_or(0) : 0;
}

std::string BTHError::description() const {
    std::string text = format("Error Domain=%@ Code=%d", domain_, code_);
    if (std::string d = localizedDescription(); !d.empty()) text += format(" \"%@\"", d);
    text += " UserInfo={";
    bool first = true;
    for (const auto& [key, value] : *userInfo_.dictionaryValue()) {
        text += format("%s%@=%@", first ? "" : ", ", key, value);
        first = false;
    }
    if (underlying_)
        text += format("%s%s=%@", first ? "" : ", ", kBTHUnderlyingErrorKey, underlying_);
    text += "}";
    return text;
}

BTHErrorRef BTHCreateErrorv(const char* function, int line, std::string_view domain, int32_t code,
                            BTHErrorRef underlying, const Value* extraUserInfo, int logFlag,
                            const char* descriptionFormat, std::span<const FormatArg> args) {
    Value userInfo =
        extraUserInfo && extraUserInfo->isDictionary() ? *extraUserInfo : Value::dictionary();
    if (descriptionFormat) {
        std::string description = formatv(descriptionFormat, args);
        if (logFlag == 1 && BTHLogEnabled(BTHLogLevelError)) {
            std::string message = underlying ? format("%d: %@ (%@)", line, description, underlying)
                                             : format("%d: %@", line, description);
            BTHLogWriteWithCode(BTHLogLevelError, function ? function : "", message, code);
        }
        userInfo.set(kBTHLocalizedDescriptionKey, std::move(description));
    }
    userInfo.set(kBTHFunctionNameKey, function ? function : "");
    userInfo.set(kBTHSourceFileLineKey, static_cast<int64_t>(line));
    return std::make_shared<const BTHError>(std::string(domain), code, std::move(userInfo),
                                            std::move(underlying));
}

BTHErrorRef BTHCreatePOSIXErrorv(const char* function, int line, int errnum,
                                 const char* descriptionFormat, std::span<const FormatArg> args) {
    Value userInfo = Value::dictionary();
    if (descriptionFormat)
        userInfo.set(kBTHLocalizedDescriptionKey, formatv(descriptionFormat, args));
    userInfo.set(kBTHFunctionNameKey, function ? function : "");
    userInfo.set(kBTHSourceFileLineKey, static_cast<int64_t>(line));
    return std::make_shared<const BTHError>(std::string(kBTHPOSIXErrorDomain), errnum,
                                            std::move(userInfo), nullptr);
}

namespace {

std::string demangledName(const char* mangled) {
    int status = 0;
    std::unique_ptr<char, decltype(&free)> name(
        abi::__cxa_demangle(mangled, nullptr, nullptr, &status), &free);
    return status == 0 && name ? name.get() : mangled;
}

Value currentCallStack() {
    void* frames[64];
    int count = backtrace(frames, 64);
    Value symbols = Value::array();
    std::unique_ptr<char*, decltype(&free)> names(backtrace_symbols(frames, count), &free);
    for (int i = 0; i < count; ++i)
        symbols.push(names ? Value(names.get()[i]) : Value(format("%p", frames[i])));
    return symbols;
}

std::atomic<BTHExceptionReporter>& reporterSlot() {
    static std::atomic<BTHExceptionReporter> slot{nullptr};
    return slot;
}

}  // namespace

BTHCaughtException BTHCaughtException::from(const std::exception_ptr& e) {
    BTHCaughtException caught;
    caught.callStackSymbols = currentCallStack();
    try {
        if (e) std::rethrow_exception(e);
    } catch (const std::exception& thrown) {
        caught.name = demangledName(typeid(thrown).name());
        caught.reason = thrown.what();
    } catch (...) {
        if (const std::type_info* type = abi::__cxa_current_exception_type())
            caught.name = demangledName(type->name());
        caught.reason = "unknown exception";
    }
    return caught;
}

BTHErrorRef BTHCreateExceptionError(const char* function, int line,
                                    const BTHCaughtException& exception) {
    return BTHCreateError(function, line, kBTHErrorDomain, BTHErrorException, nullptr, nullptr, 1,
                          "Got exception: %@ : %@", exception.reason, exception.callStackSymbols);
}

void BTHSetExceptionReporter(BTHExceptionReporter reporter) {
    reporterSlot().store(reporter);
}

void BTHReportCaughtException(const BTHCaughtException& exception) {
    if (!DeviceProperties::isInternalBuild()) return;
    if (BTHExceptionReporter reporter = reporterSlot().load()) reporter(exception);
}

}  // namespace berth
