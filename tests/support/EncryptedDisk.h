// SPDX-License-Identifier: Apache-2.0
// A small ext4 file system in a file, with one directory that is encrypted; its key comes and goes as the test says.
#pragma once

#include "support/Files.h"

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <linux/fscrypt.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <unistd.h>

namespace zor::support {

class EncryptedDisk {
public:
    /// Mounts it at `mountPoint`, a directory that is made if missing. If that cannot be (not root, no loop device,
    /// a kernel without this encryption) the disk is not there, and `missing()` says why.
    explicit EncryptedDisk(const std::string& mountPoint) : mountPoint_(mountPoint), missing_(make()) {}
    ~EncryptedDisk() {
        if (mounted_)
            ::umount2(mountPoint_.c_str(), MNT_DETACH);
    }
    EncryptedDisk(const EncryptedDisk&) = delete;

    [[nodiscard]] const std::string& missing() const { return missing_; }
    /// The encrypted directory; the key is there at first.
    [[nodiscard]] std::string directory() const { return mountPoint_ + "/encrypted"; }
    /// Whether the kernel did it. To take the key away nothing in the directory may be open.
    bool takeKeyAway() {
        fscrypt_remove_key_arg argument{};
        argument.key_spec.type = FSCRYPT_KEY_SPEC_TYPE_IDENTIFIER;
        std::memcpy(argument.key_spec.u.identifier, identifier_.data(), identifier_.size());
        ::sync();
        return ::ioctl(openDirectory(mountPoint_).get(), FS_IOC_REMOVE_ENCRYPTION_KEY, &argument) == 0 &&
               argument.removal_status_flags == 0;
    }
    bool giveKey() {
        constexpr std::size_t keyBytes = 64;
        std::vector<char> bytes(sizeof(fscrypt_add_key_arg) + keyBytes, 'k');
        fscrypt_add_key_arg argument{};
        argument.key_spec.type = FSCRYPT_KEY_SPEC_TYPE_IDENTIFIER;
        argument.raw_size = keyBytes;
        std::memcpy(bytes.data(), &argument, sizeof argument);
        if (::ioctl(openDirectory(mountPoint_).get(), FS_IOC_ADD_ENCRYPTION_KEY, bytes.data()) != 0)
            return false;
        std::memcpy(&argument, bytes.data(), sizeof argument);
        identifier_.assign(reinterpret_cast<const char*>(argument.key_spec.u.identifier), FSCRYPT_KEY_IDENTIFIER_SIZE);
        return true;
    }

private:
    std::string make() {
        if (::geteuid() != 0)
            return "not root";
        std::filesystem::create_directories(mountPoint_);
        const std::string image = mountPoint_ + ".image";
        const std::string command = "truncate -s 32M '" + image + "' && mkfs.ext4 -q -O encrypt '" + image +
                                    "' && mount -o loop '" + image + "' '" + mountPoint_ + "'";
        mounted_ = std::system(("{ " + command + "; } >/dev/null 2>&1").c_str()) == 0;
        std::filesystem::remove(image); // goes with the mount
        if (!mounted_)
            return "no ext4 in a file";
        if (!giveKey())
            return std::string("no key can be added: ") + ::strerrordesc_np(errno);
        std::filesystem::create_directory(directory());
        fscrypt_policy_v2 policy{};
        policy.version = FSCRYPT_POLICY_V2;
        policy.contents_encryption_mode = FSCRYPT_MODE_AES_256_XTS;
        policy.filenames_encryption_mode = FSCRYPT_MODE_AES_256_CTS;
        policy.flags = FSCRYPT_POLICY_FLAGS_PAD_32;
        std::memcpy(policy.master_key_identifier, identifier_.data(), identifier_.size());
        return ::ioctl(openDirectory(directory()).get(), FS_IOC_SET_ENCRYPTION_POLICY, &policy) == 0
                   ? ""
                   : std::string("no policy can be set: ") + ::strerrordesc_np(errno);
    }

    const std::string mountPoint_;
    std::string identifier_; // of the key, 16 bytes
    bool mounted_ = false;
    const std::string missing_;
};

} // namespace zor::support
