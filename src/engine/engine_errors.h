#pragma once
// The engine's error vocabulary: every failure of the storage engine reaches
// the layers above as one of these numbers, inside a DB::DBExc.
//
// The numbers are the ones the server has always reported to clients and in
// its logs, so they are kept even though SQLite does the work underneath.
// How SQLite's result codes map onto them is in sqlite_errors.h (one table)
// and in docs/architecture.md. Negative numbers are errors, positive ones
// warnings that a caller may accept.

#include <cstdint>

namespace DB::err {

// Success.
inline constexpr std::int32_t kSuccess = 0;

// Warning: the database is already attached to the instance (attaching it
// again is harmless).
inline constexpr std::int32_t kWrnDatabaseAttached = 1007;

// Internal failure that fits no other number (an unexpected SQLite result).
inline constexpr std::int32_t kInternalError = -107;

// Restore: the backup is not a database of this engine, is of a newer
// format, or is damaged.
inline constexpr std::int32_t kBadBackupFormat = -514;

// The instance or engine is shutting down.
inline constexpr std::int32_t kTermInProgress = -1000;
// A parameter or statement that the engine does not accept.
inline constexpr std::int32_t kInvalidParameter = -1003;
// The database file is read-only for this process.
inline constexpr std::int32_t kDatabaseFileReadOnly = -1008;
// The session has no open database.
inline constexpr std::int32_t kInvalidDatabaseId = -1010;
inline constexpr std::int32_t kOutOfMemory = -1011;
// An I/O error of the operating system.
inline constexpr std::int32_t kDiskIO = -1022;
// The file is not a database of this engine (another format, another
// application's database, or an unfinished creation).
inline constexpr std::int32_t kInvalidDatabase = -1028;
// A session was asked of an instance that is not initialised (held for a
// restore).
inline constexpr std::int32_t kNotInitialized = -1029;
inline constexpr std::int32_t kFileAccessDenied = -1032;

inline constexpr std::int32_t kOutOfSessions = -1101;
inline constexpr std::int32_t kWriteConflict = -1102;
inline constexpr std::int32_t kTransTooDeep = -1103;
inline constexpr std::int32_t kWriteConflictPrimaryIndex = -1105;
inline constexpr std::int32_t kRollbackRequired = -1109;

inline constexpr std::int32_t kDatabaseDuplicate = -1201;
inline constexpr std::int32_t kDatabaseNotFound = -1203;
inline constexpr std::int32_t kDatabaseCorrupted = -1206;
// The database was written by a newer version of the server.
inline constexpr std::int32_t kInvalidDatabaseVersion = -1209;
// One instance more than MaxActiveDBs.
inline constexpr std::int32_t kTooManyInstances = -1214;

inline constexpr std::int32_t kTableLocked = -1302;
inline constexpr std::int32_t kTableInUse = -1304;
inline constexpr std::int32_t kTooManyOpenTablesAndCleanupTimedOut = -1313;

inline constexpr std::int32_t kNullInvalid = -1504;
// A value longer than the engine stores in one row.
inline constexpr std::int32_t kColumnTooBig = -1506;

inline constexpr std::int32_t kRecordNotFound = -1601;
inline constexpr std::int32_t kNoCurrentRecord = -1603;
inline constexpr std::int32_t kRecordPrimaryChanged = -1604;
inline constexpr std::int32_t kKeyDuplicate = -1605;
inline constexpr std::int32_t kAlreadyPrepared = -1607;
inline constexpr std::int32_t kDataHasChanged = -1611;

// One database per instance: attaching a second file is refused.
inline constexpr std::int32_t kTooManyAttachedDatabases = -1805;
inline constexpr std::int32_t kDiskFull = -1808;
inline constexpr std::int32_t kFileNotFound = -1811;
// Restore asked of an instance that is already initialised.
inline constexpr std::int32_t kAfterInitialization = -1850;

inline constexpr std::int32_t kInvalidOperation = -1906;

}  // namespace DB::err
