// Arbitrary bytes as a container's metadata file, read back and validated for
// several users with and without the class-path check. Apps own their
// container directories and can put anything in that file; no content may
// crash the daemon, and whatever validates must describe itself.
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>

#include "BTHLog.h"
#include "BTHMetadata.h"

namespace {

namespace fs = std::filesystem;

// One per-user data container in a scratch tree, made on first use and
// removed when the process ends.
class ScratchContainer {
  public:
    ScratchContainer() {
        std::string templ = (fs::temp_directory_path() / "berth-fuzz-metadata.XXXXXX").string();
        if (!mkdtemp(templ.data())) std::abort();
        root_ = templ;
        container_ = root_ / "Containers/Data/Application/1B4E28BA-2FA1-11D2-883F-0016D3CCA427";
        fs::create_directories(container_);
    }
    ~ScratchContainer() {
        std::error_code ec;
        fs::remove_all(root_, ec);
    }

    const fs::path& container() const { return container_; }

  private:
    fs::path root_;
    fs::path container_;
};

const ScratchContainer& scratch() {
    static const ScratchContainer instance;
    return instance;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    // A handle with threshold 0 and no destination: the read's errors are
    // made with their descriptions, and their log lines are dropped.
    berth::BTHLogSetHandle(std::make_shared<berth::BTHLogHandle>("fuzz", 0));
    scratch();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const fs::path& container = scratch().container();
    {
        std::ofstream out(berth::BTHMetadata::metadataFileURL(container),
                          std::ofstream::binary | std::ofstream::trunc);
        out.write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
        if (!out) std::abort();
    }
    for (uid_t user : {0u, 33u, 499u, 501u, 502u}) {
        for (bool checkClassPath : {false, true}) {
            berth::BTHErrorRef error;
            std::shared_ptr<berth::BTHMetadata> metadata =
                berth::BTHMetadata::readAndValidateMetadataAtUrl(container, user, checkClassPath,
                                                                 &error);
            // Exactly one of a record and an error comes back.
            if (!metadata == !error) std::abort();
            if (metadata && (metadata->uid() != user || metadata->url() != container)) std::abort();
            if (metadata) (void)metadata->description();
        }
    }
    return 0;
}
