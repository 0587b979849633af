#pragma once
// Helpers shared by secli's units: the JSON and number texts that the output
// and the list command both write, and the AIDL results' output
// (secli_aidl.cpp).
#include <string>

#include "secli_lib.h"

namespace secli {

std::string jsonString(const std::string& s);
std::string secondsText(double s);

// The AIDL results' fields and line (secli_aidl.cpp).
std::string aidlJsonFields(const Result& r);
std::string aidlHumanLine(const Result& r);

}  // namespace secli
