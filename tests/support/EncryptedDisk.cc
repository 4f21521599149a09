// SPDX-License-Identifier: Apache-2.0
#include "support/EncryptedDisk.h"

#include "support/Files.h"

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <linux/fscrypt.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <unistd.h>

namespace zor::support {

namespace {

constexpr std::size_t keyBytes = 64;

std::string because(const char* what) {
    return std::string(what) + ": " + ::strerrordesc_np(errno);
}

} // namespace

EncryptedDisk::EncryptedDisk(const std::string& mountPoint) : mountPoint_(mountPoint), missing_(make()) {}

EncryptedDisk::~EncryptedDisk() {
    if (mounted_)
        ::umount2(mountPoint_.c_str(), MNT_DETACH);
}

std::string EncryptedDisk::make() {
    if (::geteuid() != 0)
        return "not root";
    std::filesystem::create_directories(mountPoint_);
    const std::string image = mountPoint_ + ".image";
    const std::string command = "truncate -s 32M '" + image + "' && mkfs.ext4 -q -O encrypt '" + image +
                                "' && mount -o loop '" + image + "' '" + mountPoint_ + "'";
    mounted_ = std::system(("{ " + command + "; } >/dev/null 2>&1").c_str()) == 0;
    std::filesystem::remove(image);
    if (!mounted_)
        return "no ext4 in a file";
    if (!giveKey())
        return because("no key can be added");
    std::filesystem::create_directory(directory());
    fscrypt_policy_v2 policy{};
    policy.version = FSCRYPT_POLICY_V2;
    policy.contents_encryption_mode = FSCRYPT_MODE_AES_256_XTS;
    policy.filenames_encryption_mode = FSCRYPT_MODE_AES_256_CTS;
    policy.flags = FSCRYPT_POLICY_FLAGS_PAD_32;
    std::memcpy(policy.master_key_identifier, identifier_.data(), identifier_.size());
    const auto encrypted = openDirectory(directory());
    return ::ioctl(encrypted.get(), FS_IOC_SET_ENCRYPTION_POLICY, &policy) == 0 ? "" : because("no policy can be set");
}

bool EncryptedDisk::giveKey() {
    std::vector<char> bytes(sizeof(fscrypt_add_key_arg) + keyBytes, 'k');
    fscrypt_add_key_arg argument{};
    argument.key_spec.type = FSCRYPT_KEY_SPEC_TYPE_IDENTIFIER;
    argument.raw_size = keyBytes;
    std::memcpy(bytes.data(), &argument, sizeof argument);
    const auto top = openDirectory(mountPoint_);
    if (::ioctl(top.get(), FS_IOC_ADD_ENCRYPTION_KEY, bytes.data()) != 0)
        return false;
    std::memcpy(&argument, bytes.data(), sizeof argument);
    identifier_.assign(reinterpret_cast<const char*>(argument.key_spec.u.identifier), FSCRYPT_KEY_IDENTIFIER_SIZE);
    return true;
}

bool EncryptedDisk::takeKeyAway() {
    fscrypt_remove_key_arg argument{};
    argument.key_spec.type = FSCRYPT_KEY_SPEC_TYPE_IDENTIFIER;
    std::memcpy(argument.key_spec.u.identifier, identifier_.data(), identifier_.size());
    const auto top = openDirectory(mountPoint_);
    ::sync();
    return ::ioctl(top.get(), FS_IOC_REMOVE_ENCRYPTION_KEY, &argument) == 0 && argument.removal_status_flags == 0;
}

} // namespace zor::support
