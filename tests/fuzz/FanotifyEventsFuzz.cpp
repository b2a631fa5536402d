// What an event borrows lies within its own bytes, names hold no NUL, and events come to an end.

#include <cstdlib>

#include "platform/eventstream/FanotifyEvents.h"

using cindral::ByteView;
using cindral::FanotifyEvent;

namespace {

void require(bool holds) {
    if (!holds) std::abort();
}

void requireWithin(ByteView inner, ByteView whole) {
    if (inner.empty()) return;
    require(inner.data() >= whole.data() && inner.data() + inner.size() <= whole.data() + whole.size());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    ByteView rest = std::as_bytes(std::span(data, size));
    while (!rest.empty()) {
        const ByteView before = rest;
        const auto event = cindral::takeFanotifyEvent(rest);
        if (!event) {
            require(rest.data() == before.data() && rest.size() == before.size());
            return 0;
        }
        require(rest.size() < before.size());
        const ByteView own = before.first(before.size() - rest.size());
        require(event->entryCount <= event->entries.size());
        for (std::size_t i = 0; i < event->entryCount; ++i) {
            const FanotifyEvent::Entry& entry = event->entries[i];
            requireWithin(entry.folder.handle, own);
            requireWithin(cindral::bytesOf(entry.name), own);
            require(entry.name.find('\0') == std::string_view::npos);
            (void)entry.folder.digest();
        }
        if (event->object) requireWithin(event->object->handle, own);
    }
    return 0;
}
