#pragma once
// The statements on table "info" (internal to the store; the tests check
// their query plans). Each is prepared once per session and cached by its
// text.
//
// Keys and folders are bound as blobs. The listings name the index
// fldStaIdx, which ends with the primary key: rows come in (folder, status,
// id) order straight from the index, with no sort, and a folder is one
// range of it. A missing index is then an error, never a silent table scan.

namespace DB::pack_sql {

// One record by its id (the primary key).
inline constexpr const char* kSelectInfo = "SELECT id, folder, status, blob FROM info WHERE id = ?1";

// Every record of folder ?1, and every record at all.
inline constexpr const char* kInfosOfFolder =
    "SELECT id, folder, status, blob FROM info INDEXED BY fldStaIdx WHERE folder = ?1 ORDER BY folder, status, id";
inline constexpr const char* kAllInfos =
    "SELECT id, folder, status, blob FROM info INDEXED BY fldStaIdx ORDER BY folder, status, id";

// The whole row is written at once: columns and JSON object never part.
inline constexpr const char* kInsertInfo = "INSERT INTO info(id, folder, status, blob) VALUES(?1, ?2, ?3, ?4)";
inline constexpr const char* kUpdateInfo = "UPDATE info SET folder = ?2, status = ?3, blob = ?4 WHERE id = ?1";

inline constexpr const char* kDeleteInfo = "DELETE FROM info WHERE id = ?1";

}  // namespace DB::pack_sql
