// Every fixed path of the system, built from KEYMGR_ROOT in this one place.
#pragma once

#include <cstddef>

#include "keymgr_build_config.h"

namespace keymgr {

// Size of the zero-filled path buffers that hold a fixed path or an entry.
inline constexpr std::size_t kPathBufferSize = 100;

inline constexpr char kManifestPath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.list";
inline constexpr char kDigestFilePath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.cb";
inline constexpr char kSignaturePath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.sig";
inline constexpr char kPolicyPath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.policy";
inline constexpr char kBootLogPath[] = KEYMGR_ROOT "/quorvan/spool/log/keymgr.log";
inline constexpr char kEventLogPath[] = KEYMGR_ROOT "/quorvan/spool/log/keymgr.events";
inline constexpr char kScDigestPath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.cs";
inline constexpr char kKeyIdPath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.hddkeyid";
inline constexpr char kKeyPwdPath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.hddpwd";
inline constexpr char kStoredOokPath[] = KEYMGR_ROOT "/quorvan/hidden/keymgr.ook";
inline constexpr char kDmsetupPath[] = KEYMGR_ROOT "/usr/local/dev-mapper/sbin/dmsetup";
inline constexpr char kEepromPath[] = KEYMGR_EEPROM_PATH;

// Modes of the files the system replaces under /quorvan/hidden: key material
// (the key files and the SC digest copy) is for the owner alone.
inline constexpr unsigned int kSecretFileMode = 0600;
inline constexpr unsigned int kDigestFileMode = 0644;

// The longest fixed path must still fit a path buffer with its terminator.
static_assert(sizeof(kDmsetupPath) <= kPathBufferSize, "KEYMGR_ROOT is too long");
static_assert(sizeof(kKeyIdPath) <= kPathBufferSize, "KEYMGR_ROOT is too long");

}  // namespace keymgr
