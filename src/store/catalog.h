#pragma once
// DB::databaseKeys: which folders below the database root are databases.
//
// A folder is a database when it holds a regular file under the database
// file's name and its own key maps back to it (paths.databaseFolder of the
// key is the folder). That leaves out the server's own folders (db.backup,
// db.temp, .config), anything below a database's data folder (data ids and
// file names are the clients' choice, the database file's name included:
// such a folder's key would escape its "d" component and name another
// folder), and links, which are never followed. Database listings, the
// backup of every database and the server's start-up checks use it.
//
// Thread safety: any thread; it only reads the file system, through env.
// Failures: the root missing is an empty list; any other failure to list a
// folder throws std::system_error.

#include <string>
#include <vector>

#include "framework/env.h"
#include "settings/paths.h"

namespace DB {

// The keys of the databases below paths.root(), in the order of the walk.
std::vector<std::string> databaseKeys(sys::Env& env, const Paths& paths);

}  // namespace DB
