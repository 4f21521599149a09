// SPDX-License-Identifier: Apache-2.0
// A class directory full of containers, each as small as one can be: a directory with its metadata file.
#pragma once

#include "base/ContainerClass.h"
#include "os/FileDescriptor.h"

#include <string>

namespace zor::bench {

class ClassTree {
public:
    /// Writes them into `directory`, which is there and empty.
    ClassTree(const std::string& directory, ContainerClass containerClass, int count);

    [[nodiscard]] int count() const { return count_; }
    [[nodiscard]] static std::string identifier(int index);
    /// All there is to know of one of them: directory name, internal UUID, identifier, user, class.
    static constexpr std::size_t recordDataBytes = 16 + 16 + 31 + 4 + 1;

    /// The floor: opens, examines, reads and closes every metadata file, in the directory's order. Seconds that it
    /// took.
    [[nodiscard]] double readAll() const;
    /// The floor of looking for containers without one: asks of every metadata file whether it is there.
    [[nodiscard]] double lookAtAll() const;

private:
    template <typename Look>
    double forEach(Look&& look) const;

    const std::string directory_;
    const int count_;
};

} // namespace zor::bench
