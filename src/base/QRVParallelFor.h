// Runs one job per index on a few threads, for work that waits on the disk
// as much as on the processor (reading many small files: with a cold page
// cache, several reads in flight at once are what makes them fast).
#pragma once

#include <cstddef>
#include <functional>

// Calls `job(i)` once for every i in [0, count), on the calling thread and
// on at most `maxThreads - 1` threads started for the call, one thread for
// every `perThread` jobs: a handful of jobs runs on the caller alone and
// pays for no thread. Jobs are handed out in index order; a job returning
// false stops the handing out (jobs already running finish). Returns once
// every thread has been joined. An exception thrown by a job stops the
// handing out likewise and is thrown again here, after the join (the first
// one when several are). A thread that cannot be started leaves its share to
// the others.
void QRVParallelFor(size_t count, size_t maxThreads, size_t perThread, const std::function<bool(size_t)>& job);
