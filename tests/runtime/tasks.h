// The threads of this process as Linux shows them in /proc/self/task: which
// exist, and how much processor time each has used. The runtime's threads
// have no names, so tests find the network thread as the one that a start
// adds and that stays.
#pragma once

#include <functional>
#include <set>

namespace tasks {

std::set<int> ids();
// User plus system time of thread `tid` in clock ticks; -1 if it is gone.
long cpuTicks(int tid);
bool alive(int tid);
// Clock ticks per second.
long ticksPerSecond();
// Polls `condition` every 5 ms until it holds or `seconds` pass.
bool eventually(const std::function<bool()>& condition, double seconds = 5.0);
// The one thread that exists now and wasn't in `before`, once short-lived
// threads (resolvers) are gone; -1 if there isn't exactly one within
// `seconds`.
int theNewThread(const std::set<int>& before, double seconds = 5.0);

}  // namespace tasks
