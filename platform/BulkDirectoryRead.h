// The bulk directory-attribute read: many entries of a directory per call,
// each with the attributes a whole-tree measurement needs, into one buffer
// the reader reuses for every directory it is given.
//
// A call reads one batch of raw entries (getdents64, 32 KiB) and then fetches
// the attributes of those that need any: a directory needs none (its type
// came with the entry and the caller opens it anyway), every other item
// needs its link count, allocation size and file id, fetched with statx
// relative to the directory without following a link. An entry carries only
// what could be fetched: `returned` says which attributes are valid, and
// `error` (when returned) says why the others are missing.
//
//   BulkDirectoryReader reader;              // one buffer for a whole walk
//   std::vector<BulkEntry> batch;
//   while (int n = reader.read(dirFd, &batch)) {
//       if (n < 0) fail(errno);
//       for (const BulkEntry& e : batch) use(e);   // names valid until the next read
//   }
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string_view>
#include <vector>

namespace berth::fs {

struct BulkEntry {
    enum Attribute : uint32_t {
        kError = 1u << 0,
        kName = 1u << 1,
        kType = 1u << 2,
        kFileId = 1u << 3,
        kEntryCount = 1u << 4,  // directories, where the file system tells it
        kLinkCount = 1u << 5,
        kAllocSize = 1u << 6,
    };
    enum class Type { Directory, File, Symlink, Other };

    uint32_t returned = 0;
    int error = 0;
    std::string_view name;  // points into the reader's buffer
    Type type = Type::Other;
    dev_t device = 0;
    uint64_t fileId = 0;
    uint64_t entryCount = 0;
    uint64_t linkCount = 0;
    uint64_t allocSize = 0;  // bytes allocated, not the logical length

    bool has(Attribute attribute) const { return (returned & attribute) != 0; }
};

class BulkDirectoryReader {
  public:
    static constexpr size_t kBufferSize = 32768;

    // `batched` false asks the attributes one entry at a time even where
    // batching is available (both ways answer alike).
    explicit BulkDirectoryReader(bool batched = true);
    ~BulkDirectoryReader();
    BulkDirectoryReader(const BulkDirectoryReader&) = delete;
    BulkDirectoryReader& operator=(const BulkDirectoryReader&) = delete;

    // Reads the next batch of the directory open as `dirFd` into `entries`
    // ("." and ".." left out). Returns the number of raw entries consumed
    // (which may exceed entries->size() by the dot entries), 0 at the end,
    // or -1 with errno set. A batch holding only "." and ".." is skipped,
    // so a positive result comes with at least one entry.
    int read(int dirFd, std::vector<BulkEntry>* entries);

  private:
    struct Attributes;
    void fetchAttributes(int dirFd, std::vector<BulkEntry>* entries);

    std::unique_ptr<unsigned char[]> buffer_;
    std::unique_ptr<Attributes> attributes_;
    std::vector<size_t> pending_;  // entries of the batch that need attributes
};

}  // namespace berth::fs
