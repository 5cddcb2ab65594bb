#include "model/HTSubrangeBuilder.h"

#include "model/HTMemoryRegion.h"

void HTSubrangeBuilder::addRun(uint64_t location, uint64_t length, HTPageKind kind)
{
    if (region_ == nullptr || kind == HTPageKind::None) return;
    if (kind == kind_ && location == location_ + length_) {
        length_ += length;
        return;
    }
    flush();
    kind_ = kind;
    location_ = location;
    length_ = length;
}

void HTSubrangeBuilder::flush()
{
    if (region_ != nullptr && kind_ != HTPageKind::None && length_ != 0)
        region_->addSubrange(location_, length_, htTotalsForPageKind(kind_, length_, region_->wired()), pageSize_);
    kind_ = HTPageKind::None;
    length_ = 0;
}
