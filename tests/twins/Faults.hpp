#pragma once

#include "twins/Twin.hpp"

#include <vector>

/// @file
/// The faults, one function for each file. serverFaults() joins them.

namespace qel::test {

std::vector<Fault> frameFaults();
std::vector<Fault> requestFaults();
std::vector<Fault> serialFaults();

} // namespace qel::test
