#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

// A JSON-ready value of auxiliary data: a number, or an object whose members
// keep the order of the map they came from. The JSON writer turns it into text.
struct HTAuxJSONValue {
    using Members = std::vector<std::pair<std::string, HTAuxJSONValue>>;

    bool isObject = false;
    int64_t number = 0;   // when not an object
    Members members;      // when an object

    static HTAuxJSONValue makeNumber(int64_t value) { return HTAuxJSONValue{false, value, {}}; }
    static HTAuxJSONValue makeObject(Members values) { return HTAuxJSONValue{true, 0, std::move(values)}; }
};

// What every auxiliary value answers, whether one datum or a nested map.
class HTAuxDataType {
public:
    virtual ~HTAuxDataType() = default;
    virtual bool isContainer() const = 0;
    virtual HTAuxJSONValue jsonRepresentation() const = 0;
};
