// SPDX-License-Identifier: Apache-2.0
#include "plist/HeldBytes.h"

namespace zor::plist {

std::size_t heldBytes(const Dictionary& dictionary) {
    std::size_t bytes = 0;
    for (const auto& [key, value] : dictionary)
        bytes += sizeof(std::string) + key.size() + heldBytes(value);
    return bytes;
}

std::size_t heldBytes(const Value& value) {
    std::size_t bytes = sizeof value;
    if (const std::string* text = value.asString())
        bytes += text->size();
    else if (const Data* data = value.asData())
        bytes += data->size();
    else if (const Dictionary* dictionary = value.asDictionary())
        bytes += heldBytes(*dictionary);
    else if (const Array* array = value.asArray())
        for (const Value& element : *array)
            bytes += heldBytes(element);
    return bytes;
}

} // namespace zor::plist
