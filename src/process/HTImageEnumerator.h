#pragma once

// Walks a process's images, sorted by start, alongside an address-ordered
// walk of its regions, answering for each region the image segment that
// overlaps it. The cursor only moves forward, so regions must be asked for
// in ascending order; an image spanning several regions is answered for
// each of them.
//
// The enumerator refers to the list itself, not a copy: images appended to
// it later are seen. The list must outlive the enumerator.

#include "process/HTImage.h"

#include <cstdint>
#include <memory>
#include <vector>

class HTImageEnumerator {
public:
    explicit HTImageEnumerator(const std::vector<std::shared_ptr<HTImage>>& images) : images_(images) {}
    // A temporary list would be gone before the first question.
    explicit HTImageEnumerator(std::vector<std::shared_ptr<HTImage>>&&) = delete;

    // The first image from the cursor on that overlaps [start, end): one
    // that holds the region's start or its last byte, or lies inside it.
    // Images wholly before the region are passed for good; null when the
    // next image lies after the region or the list is exhausted.
    std::shared_ptr<HTImage> nextImageForStart(uint64_t start, uint64_t end);

    uint64_t index() const { return index_; }

private:
    const std::vector<std::shared_ptr<HTImage>>& images_;
    uint64_t index_ = 0;
};
