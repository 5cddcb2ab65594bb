#include "process/HTImageEnumerator.h"

std::shared_ptr<HTImage> HTImageEnumerator::nextImageForStart(uint64_t start, uint64_t end)
{
    while (index_ < images_.size()) {
        const std::shared_ptr<HTImage>& image = images_[index_];
        uint64_t imageStart = image->start();
        uint64_t imageEnd = image->end();
        bool holdsStart = imageStart <= start && start < imageEnd;
        bool holdsLastByte = imageStart < end && end <= imageEnd;
        bool liesInside = start <= imageStart && imageEnd <= end;
        if (holdsStart || holdsLastByte || liesInside) return image;
        if (imageStart >= start) return nullptr;  // after the region
        index_++;                                 // wholly before it
    }
    return nullptr;
}
