#pragma once

#include "model/HTAuxDataType.h"

#include <cstdint>

// One named figure, in bytes, that a process source attaches to a process.
// Only data that may be added up across processes are kept when the
// auxiliary data of several processes are merged.
class HTAuxData : public HTAuxDataType {
public:
    HTAuxData(int64_t value, bool shouldAggregate) : aggregate_(shouldAggregate), value_(value) {}

    bool shouldAggregate() const { return aggregate_; }
    int64_t value() const { return value_; }

    bool isContainer() const override { return false; }

private:
    bool aggregate_;
    int64_t value_;
};
