// Error objects. Lower layers return false or null and hand an error object
// back through an optional `BTHErrorRef*`; client-facing operations store the
// error's code, sign-extended, through an optional `uint64_t*`.
//
// An error has a domain ("BTHErrorDomain" for the daemon's own errors, the
// POSIX domain for failed system calls), a code (a BTHErrorCode or an errno
// value) and user info: the localized description, "FunctionName",
// "SourceFileLine", any extra entries the maker gave, and the underlying
// error. Once made, an error never changes.
#pragma once

#include <cstdint>
#include <exception>
#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "BTHLog.h"
#include "core/ErrorCodes.h"
#include "core/Format.h"
#include "core/Value.h"

namespace berth {

inline constexpr std::string_view kBTHErrorDomain = "BTHErrorDomain";
inline constexpr std::string_view kBTHPOSIXErrorDomain = "POSIXErrorDomain";
// The generic domain of the property-list reader's "not a dictionary" error.
inline constexpr std::string_view kBTHGeneralErrorDomain = "GeneralErrorDomain";
inline constexpr int32_t kBTHPropertyListReadCorruptError = 2048;
// ... and of a value that has no property-list form.
inline constexpr int32_t kBTHPropertyListWriteInvalidError = 3851;

inline constexpr const char* kBTHLocalizedDescriptionKey = "LocalizedDescription";
inline constexpr const char* kBTHUnderlyingErrorKey = "UnderlyingError";
inline constexpr const char* kBTHFunctionNameKey = "FunctionName";
inline constexpr const char* kBTHSourceFileLineKey = "SourceFileLine";

class BTHError;
using BTHErrorRef = std::shared_ptr<const BTHError>;

class BTHError {
  public:
    // `userInfo` must be a dictionary; the underlying error is kept beside it
    // (reached through underlyingError()), as a dictionary cannot hold it.
    BTHError(std::string domain, int32_t code, Value userInfo, BTHErrorRef underlying);

    const std::string& domain() const { return domain_; }
    int32_t code() const { return code_; }
    const Value& userInfo() const { return userInfo_; }
    const BTHErrorRef& underlyingError() const { return underlying_; }

    bool isBTHError(int32_t code) const { return code_ == code && domain_ == kBTHErrorDomain; }
    bool isPOSIXError(int32_t code) const {
        return code_ == code && domain_ == kBTHPOSIXErrorDomain;
    }

    // The description, or empty when the error was made without one.
    std::string localizedDescription() const;
    std::string functionName() const;
    int64_t sourceFileLine() const;

    // The code as every withError location and "ReplyError" carries it.
    uint64_t code64() const { return static_cast<uint64_t>(static_cast<int64_t>(code_)); }

    // "Error Domain=<domain> Code=<code> "<description>" UserInfo={...}",
    // with the underlying error's description nested.
    std::string description() const;

  private:
    std::string domain_;
    int32_t code_;
    Value userInfo_;
    BTHErrorRef underlying_;
};

// Makes an error. `extraUserInfo` (a dictionary, or null) seeds the user
// info; "FunctionName" and "SourceFileLine" are always set and override
// entries of the same name. Without a description format there is no
// description and no log line. With one, the formatted description is stored
// and, when `logFlag` is 1, an error line "%d: %@" (or "%d: %@ (%@)" with the
// underlying error) is written under `function`.
BTHErrorRef BTHCreateErrorv(const char* function, int line, std::string_view domain, int32_t code,
                            BTHErrorRef underlying, const Value* extraUserInfo, int logFlag,
                            const char* descriptionFormat, std::span<const FormatArg> args);

template <typename... Args>
BTHErrorRef BTHCreateError(const char* function, int line, std::string_view domain, int32_t code,
                           BTHErrorRef underlying, const Value* extraUserInfo, int logFlag,
                           const char* descriptionFormat, const Args&... args) {
    if constexpr (sizeof...(Args) == 0) {
        return BTHCreateErrorv(function, line, domain, code, std::move(underlying), extraUserInfo,
                               logFlag, descriptionFormat, {});
    } else {
        const FormatArg captured[] = {FormatArg(args)...};
        return BTHCreateErrorv(function, line, domain, code, std::move(underlying), extraUserInfo,
                               logFlag, descriptionFormat, captured);
    }
}

// Makes a POSIX-domain error with exactly the description, "FunctionName"
// and "SourceFileLine". Never logs.
BTHErrorRef BTHCreatePOSIXErrorv(const char* function, int line, int errnum,
                                 const char* descriptionFormat, std::span<const FormatArg> args);

template <typename... Args>
BTHErrorRef BTHCreatePOSIXError(const char* function, int line, int errnum,
                                const char* descriptionFormat, const Args&... args) {
    if constexpr (sizeof...(Args) == 0) {
        return BTHCreatePOSIXErrorv(function, line, errnum, descriptionFormat, {});
    } else {
        const FormatArg captured[] = {FormatArg(args)...};
        return BTHCreatePOSIXErrorv(function, line, errnum, descriptionFormat, captured);
    }
}

// Stores `error` through `out` when `out` is not null.
inline void BTHSetError(BTHErrorRef* out, BTHErrorRef error) {
    if (out) *out = std::move(error);
}

// Stores `code` through `out` when `out` is not null.
inline void BTHSetErrorCode(uint64_t* out, uint64_t code) {
    if (out) *out = code;
}

// An exception caught at an operation's boundary, as the exception rule
// reports it: its type name, its text, and the call stack where it was
// caught.
struct BTHCaughtException {
    std::string name;
    std::string reason;
    Value callStackSymbols = Value::array();

    static BTHCaughtException from(const std::exception_ptr& e);
    std::string description() const { return reason; }
};

// The error of the exception rule: code 40, "Got exception: %@ : %@" with the
// exception's text and its call stack, logged under `function`.
BTHErrorRef BTHCreateExceptionError(const char* function, int line,
                                    const BTHCaughtException& exception);

// The rest of the exception rule, after its error is made: on internal builds
// the uncaught-exception reporter ends the process. Start-up installs the
// reporter; until then (and in tests) nothing happens.
using BTHExceptionReporter = void (*)(const BTHCaughtException& exception);
void BTHSetExceptionReporter(BTHExceptionReporter reporter);
void BTHReportCaughtException(const BTHCaughtException& exception);

// Runs `body`, which returns an error or null, under the exception rule: an
// exception escaping it becomes the code-40 error (logged under `function`)
// and is reported, and that error is the result.
template <class Body>
BTHErrorRef BTHRunUnderExceptionRule(const char* function, int line, Body&& body) {
    try {
        return body();
    } catch (...) {
        const BTHCaughtException caught = BTHCaughtException::from(std::current_exception());
        BTHErrorRef error = BTHCreateExceptionError(function, line, caught);
        BTHReportCaughtException(caught);
        return error;
    }
}

}  // namespace berth

// The makers as the daemon's code uses them, under the enclosing function's
// BTH_FUNCTION name and the current source line.
#define BTHMakeError(code, underlying, ...)                                                        \
    ::berth::BTHCreateError(bthFunctionName, __LINE__, ::berth::kBTHErrorDomain, code, underlying, \
                            nullptr, 1, __VA_ARGS__)
#define BTHMakeUnloggedError(code, underlying, ...)                                                \
    ::berth::BTHCreateError(bthFunctionName, __LINE__, ::berth::kBTHErrorDomain, code, underlying, \
                            nullptr, 0, __VA_ARGS__)
#define BTHMakePOSIXError(errnum, ...) \
    ::berth::BTHCreatePOSIXError(bthFunctionName, __LINE__, errnum, __VA_ARGS__)
