// SPDX-License-Identifier: Apache-2.0
#include "os/SerialWorkQueue.h"

#include "platform/Errno.h"

#include <exception>
#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zor::platform {

namespace {

// linux/ioprio.h, which older kernel headers lack.
constexpr int ioprioWhoProcess = 1;
constexpr int ioprioClassIdle = 3;
constexpr int ioprioClassShift = 13;

/// A quarter of the processor time of others, no less: jobs take locks that others wait for (the log's, the memory's,
/// the kernel's own of a file system's journal). On a crowded system a thread of the lowest priority that was
/// interrupted inside such a lock kept it for half a minute; with this one others wait as long as for an equal.
constexpr int backgroundNice = 5;

void becomeBackground() {
    // Both act on the calling thread. The queue works all the same without them.
    (void)::setpriority(PRIO_PROCESS, static_cast<id_t>(::gettid()), backgroundNice);
    (void)::syscall(SYS_ioprio_set, ioprioWhoProcess, 0, ioprioClassIdle << ioprioClassShift);
}

void nameThisThread(const std::string& label) {
    constexpr std::size_t nameBytesMax = 15;
    const std::size_t dot = label.rfind('.');
    const std::string name = label.substr(dot == std::string::npos ? 0 : dot + 1, nameBytesMax);
    (void)::pthread_setname_np(::pthread_self(), name.c_str());
}

} // namespace

SerialWorkQueue::SerialWorkQueue(std::string label, Priority priority)
    : label_(std::move(label)), priority_(priority) {}

SerialWorkQueue::~SerialWorkQueue() {
    finish();
}

void SerialWorkQueue::finish() {
    std::deque<std::function<void()>> dropped;
    std::thread thread;
    {
        const MutexLock lock(mutex_);
        ending_ = true;
        if (suspended_ || !thread_.joinable())
            dropped.swap(jobs_);
        suspended_ = false;
        thread = std::move(thread_);
    }
    changed_.broadcast();
    dropped.clear();
    if (thread.joinable())
        thread.join();
    const MutexLock lock(mutex_);
    finished_ = true;
}

bool SerialWorkQueue::start() {
    const MutexLock lock(mutex_);
    if (thread_.joinable())
        return true;
    try {
        thread_ = std::thread(&SerialWorkQueue::work, this);
    } catch (const std::exception&) {
        return false; // no thread, or no memory for one
    }
    return true;
}

void SerialWorkQueue::async(std::function<void()> job) {
    ZOR_ASSERT(job); // an empty one would end the thread
    {
        const MutexLock lock(mutex_);
        if (finished_)
            return;
        jobs_.push_back(std::move(job));
    }
    changed_.signal();
}

void SerialWorkQueue::suspend() {
    const MutexLock lock(mutex_);
    ZOR_ASSERT(!suspended_);
    suspended_ = !ending_;
}

void SerialWorkQueue::resume() {
    {
        const MutexLock lock(mutex_);
        suspended_ = false;
    }
    changed_.signal();
}

std::function<void()> SerialWorkQueue::next() {
    const MutexLock lock(mutex_);
    while (suspended_ || jobs_.empty()) {
        if (ending_)
            return {};
        changed_.wait(mutex_);
    }
    std::function<void()> job = std::move(jobs_.front());
    jobs_.pop_front();
    return job;
}

void SerialWorkQueue::work() {
    nameThisThread(label_);
    if (priority_ == Priority::background)
        becomeBackground();
    // A job is destroyed before the next one begins: what it holds (a busy mark) ends with it.
    for (std::function<void()> job = next(); job; job = next()) {
        job();
        job = nullptr;
    }
}

} // namespace zor::platform
