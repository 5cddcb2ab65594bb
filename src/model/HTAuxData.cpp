#include "model/HTAuxData.h"

HTAuxJSONValue HTAuxData::jsonRepresentation() const { return HTAuxJSONValue::makeNumber(value_); }
