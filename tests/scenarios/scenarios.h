/* The scenarios that the explorer plays. */
#pragma once

#include <memory>
#include <vector>

#include "sim/explore/scenario.h"

std::vector<std::unique_ptr<sim::Scenario>> scenarios();
