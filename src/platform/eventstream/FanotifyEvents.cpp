#include "platform/eventstream/FanotifyEvents.h"

#include <sys/fanotify.h>

#include <cstring>

#include "platform/foundation/Sys.h"

// Headers of before Linux 5.17 don't have them.
#ifndef FAN_EVENT_INFO_TYPE_OLD_DFID_NAME
#define FAN_EVENT_INFO_TYPE_OLD_DFID_NAME 10
#define FAN_EVENT_INFO_TYPE_NEW_DFID_NAME 12
#endif

namespace cindral {

namespace {

/// The value at the front, which is taken off; none when the bytes end within it. Nothing is aligned in here.
template <typename T>
std::optional<T> take(ByteView& bytes) {
    if (bytes.size() < sizeof(T)) return std::nullopt;
    T value;
    std::memcpy(&value, bytes.data(), sizeof value);
    bytes = bytes.subspan(sizeof value);
    return value;
}

/// What all records but those of other kinds begin with, behind their header.
std::optional<FanotifyEvent::Object> takeObject(ByteView& record) {
    const auto fileSystem = take<std::uint64_t>(record);
    const auto size = take<std::uint32_t>(record);
    const auto type = take<std::int32_t>(record);
    if (!fileSystem || !size || !type || *size > record.size() || *size > FileHandle::kBytesMax) return std::nullopt;
    const FanotifyEvent::Object object{.fileSystem = *fileSystem, .handleType = *type, .handle = record.first(*size)};
    record = record.subspan(*size);
    return object;
}

bool addEntry(FanotifyEvent& event, ByteView record, bool hasName) {
    const auto folder = takeObject(record);
    if (!folder || event.entryCount == event.entries.size()) return false;
    std::string_view name;
    if (hasName) {
        const std::size_t end = textOf(record).find('\0');
        if (end == std::string_view::npos) return false;
        name = textOf(record).substr(0, end);
    }
    event.entries[event.entryCount++] = {.folder = *folder, .name = name};
    return true;
}

bool addRecord(FanotifyEvent& event, std::uint8_t type, ByteView record) {
    switch (type) {
        case FAN_EVENT_INFO_TYPE_DFID_NAME:
        case FAN_EVENT_INFO_TYPE_OLD_DFID_NAME:
        case FAN_EVENT_INFO_TYPE_NEW_DFID_NAME: return addEntry(event, record, true);
        case FAN_EVENT_INFO_TYPE_DFID: return addEntry(event, record, false);
        case FAN_EVENT_INFO_TYPE_FID: event.object = takeObject(record); return event.object.has_value();
        default: return true;  // Of a kind that wasn't asked for, or of a later kernel.
    }
}

bool addRecords(FanotifyEvent& event, ByteView records) {
    while (!records.empty()) {
        ByteView rest = records;
        const auto header = take<fanotify_event_info_header>(rest);
        if (!header || header->len < sizeof *header || header->len > records.size()) return false;
        if (!addRecord(event, header->info_type, rest.first(header->len - sizeof *header))) return false;
        records = records.subspan(header->len);
    }
    return true;
}

}  // namespace

std::uint64_t FanotifyEvent::Object::digest() const {
    // FNV-1a, over the eight-byte words of what identifies the object and then over the bytes that are left.
    std::uint64_t sum = 0xCBF2'9CE4'8422'2325;
    const auto add = [&sum](std::uint64_t value) {
        sum = (sum ^ value) * 0x100'0000'01B3;
        sum ^= sum >> 32;  // The multiplication alone never carries a high bit down.
    };
    add(fileSystem);
    add(static_cast<std::uint32_t>(handleType) | std::uint64_t{handle.size()} << 32);
    ByteView rest = handle;
    while (const auto word = take<std::uint64_t>(rest)) add(*word);
    for (const std::byte byte : rest) add(std::to_integer<std::uint64_t>(byte));
    return sum;
}

std::optional<FanotifyEvent> takeFanotifyEvent(ByteView& bytes) {
    ByteView rest = bytes;
    const auto header = take<fanotify_event_metadata>(rest);
    if (!header || header->vers != FANOTIFY_METADATA_VERSION) return std::nullopt;
    if (header->metadata_len < sizeof *header || header->metadata_len > header->event_len) return std::nullopt;
    if (header->event_len > bytes.size()) return std::nullopt;
    FanotifyEvent event;
    event.mask = header->mask;
    const ByteView whole = bytes.first(header->event_len);
    if (!addRecords(event, whole.subspan(header->metadata_len))) return std::nullopt;
    bytes = bytes.subspan(whole.size());
    return event;
}

}  // namespace cindral
