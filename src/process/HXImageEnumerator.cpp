#include "process/HXImageEnumerator.h"

const HXImage *HXImageEnumerator::nextImageForStart(uint64_t start, uint64_t end) {
    for (; _index < _images.size(); _index++) {
        const HXImage &image = _images[_index];
        const bool startsInside = start >= image.start() && start < image.end();
        const bool endsInside = image.start() < end && image.end() >= end;
        const bool holdsImage = image.end() <= end && image.start() >= start;
        if (startsInside || endsInside || holdsImage) return &image;
        if (image.start() >= start) return nullptr; // wholly past the range
    }
    return nullptr;
}
