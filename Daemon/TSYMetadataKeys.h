// The keys of a container's metadata file.
#pragma once

inline constexpr char kTSYMetadataVersion[] = "TSYMetadataVersion";
inline constexpr char kTSYMetadataIdentifier[] = "TSYMetadataIdentifier";
inline constexpr char kTSYMetadataUUID[] = "TSYMetadataUUID";
inline constexpr char kTSYMetadataContentClass[] = "TSYMetadataContentClass";
inline constexpr char kTSYMetadataUserIdentity[] = "TSYMetadataUserIdentity";
// The owning uid, in files written before there were user identities. Read, never written.
inline constexpr char kTSYMetadataPersona[] = "TSYMetadataPersona";
inline constexpr char kTSYMetadataInfo[] = "TSYMetadataInfo";
inline constexpr char kTSYMetadataUserManagedAssetsDirName[] =
    "TSYMetadataUserManagedAssetsDirName";

// The value of the version key: a string.
inline constexpr char kTSYMetadataCurrentVersion[] = "2";
