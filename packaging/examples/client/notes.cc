// SPDX-License-Identifier: Apache-2.0
// The same as notes.c, in C++17.
//
//     c++ -std=c++17 notes.cc $(pkg-config --cflags --libs zorvane) -o notes && ./notes
#include <zorvane/zorvane.hpp>

#include <iostream>

int main(int count, char** arguments) {
    try {
        zorvane::stable::Client client(count > 1 ? arguments[1] : "/");
        const auto notes = client.create(ZORVANE_DATA_APPLICATION, "org.example.notes");
        const auto stored = client.info(notes, "starts");
        const std::int64_t starts = (stored ? stored->integer().value_or(0) : 0) + 1;
        client.setInfo(notes, "starts", starts);
        std::cout << notes.path << ", start " << starts << '\n';
        return 0;
    } catch (const zorvane::stable::Error& error) {
        std::cerr << "notes: " << error.what() << "\nnotes: " << error.advice() << '\n';
        return static_cast<int>(error.kind());
    }
}
