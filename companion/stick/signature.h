#pragma once

#include "findings.h"

#include <string>

/// Beside `debs`, where the updater does not look: what the maker put on the stick, and his signature of that.
inline constexpr char manifestName[] = "harl-updater.manifest";
inline constexpr char signatureName[] = "harl-updater.manifest.sig";
/// With it the service runs the updater only with a stick that one of its keys signed; see docs/security.md.
inline constexpr char installedKeyring[] = "/usr/share/keyrings/harl-updater-stick.gpg";

/// Writes the manifest of all that lies in `debs` on a stick, and its detached signature.
///
/// @param stick    the folder that the stick is mounted at
/// @param version  the board's, that the stick carries
/// @param oldest   the oldest version that this one may replace; empty: any
/// @param key      as gpg(1) takes it; it asks for a passphrase on the terminal
/// @throws std::runtime_error when a file cannot be listed or a tool fails
void signStick(const std::string& stick, const std::string& version, const std::string& oldest, const std::string& key);

/// Verifies the stick with the service's own verify-stick and adds what is wrong to `report`; nothing without a keyring
/// and without a manifest.
///
/// @param keyring  the file with the keys; empty: the installed one, if there is any
void checkSignature(const std::string& stick, const std::string& keyring, Report& report);

/// Compares the board's version, when it is a fact of `report`, with what the manifest lets it be replaced by.
void checkReplaced(const std::string& stick, Report& report);
