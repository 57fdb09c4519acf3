#include "ScratchDeviceRoot.h"

#include <cstdlib>
#include <stdexcept>

#include "TestSupport.h"

namespace berth::test {

namespace {

void writeDatabases(const std::filesystem::path& root, bool withMobileUser) {
    std::filesystem::create_directories(root / "etc");
    std::string passwd =
        "root:x:0:0:root:/private/var/root:/bin/sh\n"
        "_bundles:x:33:33:bundles:/private/var/ladingd:/usr/sbin/nologin\n"
        "_system:x:499:499:system containers:/private/var/empty:/usr/sbin/nologin\n";
    if (withMobileUser) passwd += "mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh\n";
    passwd += "other:x:502:502:Other:/private/var/other:/bin/sh\n";
    writeFile(root / "etc/passwd", passwd);
    writeFile(root / "etc/group",
              "root:x:0:\nsystemusers:x:510:_system\nmobile:x:501:\nother:x:502:\n");
    for (const char* home : {"private/var/root", "private/var/ladingd", "private/var/empty",
                             "private/var/mobile", "private/var/other"})
        std::filesystem::create_directories(root / home);
}

class Root {
  public:
    explicit Root(const ScratchDeviceRootOptions& options) {
        std::string templ = "/tmp/berth-root.XXXXXX";
        if (!mkdtemp(templ.data())) throw std::runtime_error("mkdtemp failed");
        path_ = templ;
        writeDatabases(path_, options.withMobileUser);
        setenv("BERTH_ROOT", path_.c_str(), 1);
    }
    ~Root() {
        std::error_code ec;
        std::filesystem::remove_all(path_, ec);
    }
    const std::filesystem::path& path() const { return path_; }

  private:
    std::filesystem::path path_;
};

}  // namespace

const std::filesystem::path& installScratchDeviceRoot(const ScratchDeviceRootOptions& options) {
    static const Root root(options);
    return root.path();
}

}  // namespace berth::test
