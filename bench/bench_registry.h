// The benchmark groups, registered by name from main so that the summary can pair each
// library figure with its baseline ("<scenario>/library" and "<scenario>/baseline").
#ifndef FILEINDEX_BENCH_BENCH_REGISTRY_H
#define FILEINDEX_BENCH_BENCH_REGISTRY_H

namespace bench {

void RegisterQueueBenchmarks();
void RegisterConfigBenchmarks();

}  // namespace bench

#endif
