// SPDX-License-Identifier: Apache-2.0
#include "Scratch.h"

#include "Processes.h"
#include "Report.h"
#include "device/DeviceQueries.h"

#include <cerrno>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <linux/loop.h>
#include <sched.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

constexpr int formatMilliseconds = 60'000;
constexpr int loopTriesMax = 16;

bool makeExt4(const std::string& image, Place::Size size) {
    const std::string inodes = std::to_string(size.inodes);
    ChildProcess mkfs([&] {
        for (const char* program : {"/usr/sbin/mkfs.ext4", "/sbin/mkfs.ext4", "/usr/bin/mkfs.ext4"})
            ::execl(program, "mkfs.ext4", "-q", "-F", "-b", "4096", "-N", inodes.c_str(), "-O", "has_journal", "-E",
                    "lazy_itable_init=0,lazy_journal_init=0", image.c_str(), static_cast<char*>(nullptr));
    });
    return mkfs.waitFor(formatMilliseconds) == 0;
}

/// A loop device over the image. Direct, so that the image is not kept in memory a second time, where that is possible.
FileDescriptor attachLoop(int image, std::string& device) {
    const FileDescriptor control(::open("/dev/loop-control", O_RDWR | O_CLOEXEC));
    for (int tried = 0; control.valid() && tried < loopTriesMax; ++tried) {
        const int number = ::ioctl(control.get(), LOOP_CTL_GET_FREE);
        if (number < 0)
            return {};
        device = "/dev/loop" + std::to_string(number);
        FileDescriptor loop(::open(device.c_str(), O_RDWR | O_CLOEXEC));
        if (!loop.valid())
            return {};
        loop_config config{};
        config.fd = static_cast<std::uint32_t>(image);
        config.info.lo_flags = LO_FLAGS_AUTOCLEAR | LO_FLAGS_DIRECT_IO;
        int configured = ::ioctl(loop.get(), LOOP_CONFIGURE, &config);
        if (configured < 0 && errno == EINVAL) {
            config.info.lo_flags = LO_FLAGS_AUTOCLEAR;
            configured = ::ioctl(loop.get(), LOOP_CONFIGURE, &config);
        }
        if (configured == 0)
            return loop;
        if (errno != EBUSY) // somebody else was faster
            return {};
    }
    return {};
}

/// The data mode that the driver says is in force, such as "data=ordered".
std::string journalMode(const std::string& device) {
    std::ifstream options("/proc/fs/ext4/" + device.substr(device.rfind('/') + 1) + "/options");
    for (std::string line; std::getline(options, line);)
        if (line.starts_with("data="))
            return line;
    return "no journal";
}

std::string describeDirectory(const std::string& path) {
    struct statfs fileSystem{};
    struct stat status{};
    if (::statfs(path.c_str(), &fileSystem) != 0 || ::stat(path.c_str(), &status) != 0)
        return "a fresh directory";
    return text("a fresh directory on device %u:%u (file system 0x%lx)", major(status.st_dev), minor(status.st_dev),
                static_cast<unsigned long>(fileSystem.f_type));
}

} // namespace

Scratch::Scratch(std::string directory) : path_(std::move(directory)) {
    std::filesystem::create_directories(path_);
    held_.reset(::open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!held_.valid())
        failWithErrno(path_);
    if (::flock(held_.get(), LOCK_EX | LOCK_NB) != 0)
        throw Failure(path_ + " is in use by another run");
    empty();
}

Scratch::~Scratch() {
    empty();
    ::rmdir(path_.c_str());
}

void Scratch::empty() const {
    std::error_code ignored;
    for (const auto& entry : std::filesystem::directory_iterator(path_, ignored)) {
        const std::string place = entry.path();
        // The daemon's boot marker lies outside its root.
        if (const auto root = platform::SystemRoot::open(place))
            platform::SemaphoreBootMarker(*root).forget();
        ::umount2(place.c_str(), MNT_DETACH);
        std::filesystem::remove_all(place, ignored);
    }
}

void separateMounts() {
    if (::unshare(CLONE_NEWNS) == 0)
        ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr);
}

Place::Place(const Scratch& scratch, const std::string& name, Size size) : path_(scratch.path() + "/" + name) {
    if (::mkdir(path_.c_str(), 0755) != 0)
        failWithErrno(path_);
    mounted_ = ::geteuid() == 0 && mountFresh(path_ + ".image", size);
    if (!mounted_)
        description_ = describeDirectory(path_) + ", since no fresh file system could be mounted here";
}

bool Place::mountFresh(const std::string& imagePath, Size size) {
    const FileDescriptor image(::open(imagePath.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    bool done = false;
    std::string device;
    if (image.valid() && ::ftruncate(image.get(), static_cast<off_t>(size.bytes)) == 0 && makeExt4(imagePath, size))
        if (const FileDescriptor loop = attachLoop(image.get(), device); loop.valid())
            done = ::mount(device.c_str(), path_.c_str(), "ext4", 0, "data=ordered") == 0;
    ::unlink(imagePath.c_str());
    if (done)
        description_ = "a fresh ext4 (" + journalMode(device) + ") on " + device;
    return done;
}

Place::~Place() {
    if (const auto root = platform::SystemRoot::open(path_))
        platform::SemaphoreBootMarker(*root).forget();
    if (mounted_)
        ::umount2(path_.c_str(), MNT_DETACH);
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
}

void writeOut(const std::string& path) {
    const FileDescriptor place(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ::syncfs(place.get());
}

bool dropCaches(const std::string& path) {
    writeOut(path);
    const FileDescriptor control(::open("/proc/sys/vm/drop_caches", O_WRONLY | O_CLOEXEC));
    return control.valid() && ::write(control.get(), "3", 1) == 1;
}

} // namespace zor::bench
