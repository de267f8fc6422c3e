// The scenario groups of the benchmark, one source file each; main.cpp runs
// them in the order of its table. A new group: a file in this directory and a
// line here and in that table.
#pragma once

#include "bench.h"

// Commands 3 and 7 beside their floors (bench/floors/echo_peer.h).
bool bench_group_queries(const bench_options& options, bench_report* report);
// The 24-tile deck, on an open connection and on a fresh one.
bool bench_group_deck(const bench_options& options, bench_report* report);
// Data pulls of 50 items beside a one-process floor, with and without
// server latency; 500 and 5000 items per item; peak memory.
bool bench_group_pull(const bench_options& options, bench_report* report);
// Connect to handshake through the activator, and memory after it.
bool bench_group_startup(const bench_options& options, bench_report* report);
