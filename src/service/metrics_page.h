#pragma once
// The /metrics page of the server (Prometheus text format): the
// commands' counts and times, the connections, the memory budget, the
// bytes on the wire, the open databases against their limit, and the read
// cache's hit rate.

#include <string>

class DBConfig;

namespace DB {
class DBInstances;
}
namespace Ipc::DB {
class Listener;
}

namespace DBServer {

std::string metricsPage(Ipc::DB::Listener& listener, const DB::DBInstances& pool, const DBConfig& config);

}  // namespace DBServer
