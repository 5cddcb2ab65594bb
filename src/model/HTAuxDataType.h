#pragma once

// What every auxiliary value answers, whether one datum or a nested map.
class HTAuxDataType {
public:
    virtual ~HTAuxDataType() = default;
    virtual bool isContainer() const = 0;
};
