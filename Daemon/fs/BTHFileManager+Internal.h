// Pieces shared by the file manager's source files.
#pragma once

#include <sys/acl.h>

#include <cstring>
#include <string>
#include <utility>

namespace berth::filemanager {

// The text of an error number, as the messages quote it.
inline std::string errorText(int errnum) {
    char buffer[256];
    return ::strerror_r(errnum, buffer, sizeof buffer);
}

// Owns one ACL of libacl and frees it when it goes out of scope.
class UniqueAcl {
  public:
    UniqueAcl() = default;
    explicit UniqueAcl(acl_t acl) : acl_(acl) {}
    UniqueAcl(UniqueAcl&& other) noexcept : acl_(std::exchange(other.acl_, nullptr)) {}
    UniqueAcl& operator=(UniqueAcl&& other) noexcept {
        if (this != &other) reset(std::exchange(other.acl_, nullptr));
        return *this;
    }
    UniqueAcl(const UniqueAcl&) = delete;
    UniqueAcl& operator=(const UniqueAcl&) = delete;
    ~UniqueAcl() { reset(); }

    acl_t get() const { return acl_; }
    // For calls that may reallocate the ACL in place (acl_create_entry).
    acl_t* address() { return &acl_; }
    explicit operator bool() const { return acl_ != nullptr; }

    void reset(acl_t acl = nullptr) {
        if (acl_) ::acl_free(acl_);
        acl_ = acl;
    }

  private:
    acl_t acl_ = nullptr;
};

}  // namespace berth::filemanager
