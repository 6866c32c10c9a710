// Medians of repetitions that take turns, so that what else the machine does meets all alike.
#pragma once

#include <benchmark/benchmark.h>

#include <functional>
#include <vector>

#include "Report.h"

// Which clock counts: the thread's processor time for what only computes, the wall clock for what waits for others.
enum class Count { processor, wall };

using Body = std::function<void(benchmark::State&)>;

// Seconds an iteration, the median of each body, in their order.
std::vector<double> medians(Count count, const std::vector<Body>& bodies);

// Ours beside a reference.
void compare(Report& report, const std::string& metric, double goal, Count count, const Body& ours,
             const Body& reference);

// For whole processes: both once a turn, each answering its own figure.
std::pair<double, double> medianTurns(int turns, const std::function<double()>& ours,
                                      const std::function<double()>& reference);
double median(std::vector<double> figures);
