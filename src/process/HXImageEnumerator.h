// A cursor over a process's image segments, for a walk in ascending order.
#pragma once

#include "process/HXImage.h"

#include <cstdint>
#include <vector>

class HXImageEnumerator {
  public:
    // Looks at the list itself, which must outlive the enumerator, be sorted by start, and may grow at its
    // end.
    explicit HXImageEnumerator(const std::vector<HXImage> &images) : _images(images) {}

    // The image that overlaps [start, end), or null. Successive calls ask for ranges in ascending order; the
    // image answers later ranges, too, until it lies wholly before them. Valid until the list grows.
    const HXImage *nextImageForStart(uint64_t start, uint64_t end);

  private:
    const std::vector<HXImage> &_images;
    uint32_t _index = 0;
};
