#include "platform/tessel/TesselTypes.h"

namespace cindral {
namespace {

const TesselPage* pageOfText(std::string_view text) {
    const ByteView bytes = bytesOf(text);
    return new TesselPage(bytes.begin(), bytes.end());
}

}  // namespace

// An encoded position is a binary property list, which begins otherwise. Never destroyed: threads that still run while
// the process ends may ask.
const TesselPage& tesselInitialPageSortedByName() {
    static const TesselPage& page = *pageOfText("TesselInitialPageSortedByName");
    return page;
}

const TesselPage& tesselInitialPageSortedByDate() {
    static const TesselPage& page = *pageOfText("TesselInitialPageSortedByDate");
    return page;
}

const TesselPage& tesselInitialPageForFollowers() {
    static const TesselPage& page = *pageOfText("TesselInitialPageForFollowers");
    return page;
}

}  // namespace cindral
