// SPDX-License-Identifier: Apache-2.0
// A tree of files such as an application keeps, and bare walks over it: one thread, every directory opened by its name
// in its parent and read in large pieces, and for each entry the system calls that its purpose takes.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace zor::bench {

class ContentTree {
public:
    struct Shape {
        int files = 0;
        std::size_t fileBytes = 0;
        int contentEvery = 1; // one file in so many has content, the others are empty
    };
    /// Makes it at `path`, where nothing is: a hundred files in each directory, a hundred of those in each one above.
    ContentTree(std::string path, const Shape& shape);

    [[nodiscard]] const std::string& path() const { return path_; }
    [[nodiscard]] int files() const { return shape_.files; }

    struct Usage {
        double seconds = 0;
        std::uint64_t bytes = 0; // of files, as the file system allots them
    };
    /// openat, getdents64, fstatat.
    [[nodiscard]] Usage measure() const;
    /// openat, getdents64, unlinkat; seconds that it took. The tree is gone then.
    double remove() const;
    /// open, fgetxattr, fsetxattr, close of each file, and the same of each directory. Seconds that it took; a failure
    /// when a file had another value than `from`.
    double setAttributes(const char* attribute, char from, char to) const;
    /// The same without looking at what was there.
    void initializeAttributes(const char* attribute, char value) const;

private:
    void checkCount(int files) const;

    const std::string path_;
    const Shape shape_;
};

} // namespace zor::bench
