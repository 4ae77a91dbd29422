// What is measured, a function a subject; each fills the tables that it prints.
#pragma once

#include <cstddef>
#include <string>

#include "bench/Device.hpp"
#include "bench/Report.hpp"

namespace bench {

constexpr int rounds = 5;

// `programs` is the folder of the built programs.
void measureReads(const std::string& programs);
void measureRates(const std::string& programs);
void measureConnects(const std::string& programs);
void measurePosts(const std::string& programs);
void measureSwitches(const std::string& programs);
void measureChanges(const std::string& programs);
void measureStarts(const std::string& programs);
void measureRest(const std::string& programs);
void measureGrowth(const std::string& programs);
void measureAccounts(const std::string& programs);

}  // namespace bench
