// How replies are shown: as JSON, as labelled lines, or as a refusal on standard error.
#pragma once

#include <functional>
#include <initializer_list>
#include <string>
#include <string_view>
#include <utility>

#include "veltoidctl/Arguments.h"
#include "veltoidctl/Json.h"

namespace veltoidctl {

/// The text on one line. Control characters, which may come from the server, become "?".
std::string textOf(const Json& value);

void printLine(const std::string& label, const Json& value);

/// Prints the entries that the dictionary has, in the given order, under readable labels.
void printEntries(const Json& dictionary,
                  std::initializer_list<std::pair<std::string_view, const char*>> entries);

void printJson(const Json& value);

/// Says on standard error what did not work, and why: `otherwise` when the reply tells nothing, or only that
/// it was not done.
void printRefusal(const Json& reply, const std::string& what, const std::string& otherwise);

/// Prints the reply as JSON when that was asked for, else what `print` makes of a success, or the refusal.
/// Returns the exit status.
int present(const Json& reply, const Arguments& arguments, const std::string& what,
            const std::function<void(const Json&)>& print, const std::string& otherwise = {});

}  // namespace veltoidctl
