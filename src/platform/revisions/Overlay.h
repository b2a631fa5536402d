#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/revisions/PackedRecord.h"

namespace cindral {

/// What one log file holds and the tables don't have yet: the newest record of each object, and the documents given.
///
/// About 60 bytes and the name for each record. Memory is taken as records come.
///
/// Thread safety: the caller's. Once nobody writes to it any more, everybody may read.
class Overlay {
public:
    /// Takes the record in place of an older one of the object.
    void put(FileID fileID, const PackedRecord& record);
    /// Documents come in the order of their IDs.
    void addDocument(DocumentID documentID, const DocumentRecord& document);

    /// The name points into the overlay and lives as long as it.
    std::optional<PackedRecord> find(FileID fileID) const;
    std::optional<DocumentRecord> findDocument(DocumentID documentID) const;

    bool empty() const { return count_ == 0; }
    /// Bytes of records that it holds, replaced ones included.
    std::size_t bytes() const { return bytes_; }
    std::size_t count() const { return count_; }

    using Object = std::pair<FileID, ByteView>;
    std::vector<Object> objectsInKeyOrder() const;
    using Document = std::pair<DocumentID, DocumentRecord>;
    const std::vector<Document>& documents() const { return documents_; }

private:
    std::byte* allocate(std::size_t size);
    std::size_t slotOf(FileID fileID) const;
    void grow();

    struct Unmap {
        void operator()(std::byte* chunk) const;
    };
    std::vector<std::unique_ptr<std::byte, Unmap>> chunks_;
    std::size_t chunkLeft_ = 0;
    std::byte* chunkNext_ = nullptr;
    std::vector<const std::byte*>
        slots_;  // Open addressing, a power of two; each points to file ID, size, packed record.
    std::size_t count_ = 0;
    std::size_t bytes_ = 0;
    std::vector<Document> documents_;
};

}  // namespace cindral
