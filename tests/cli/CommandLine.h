#pragma once

#include <string>
#include <utility>
#include <vector>

/// An argument vector as the program's entry gets it: the program's name first, writable, NULL at the end.
class CommandLine {
public:
    explicit CommandLine(std::vector<std::string> arguments) : _arguments(std::move(arguments)) {
        _arguments.insert(_arguments.begin(), "memweight");
        for (auto& argument : _arguments) {
            _pointers.push_back(argument.data());
        }
        _pointers.push_back(nullptr);
    }
    CommandLine(const CommandLine&) = delete;
    CommandLine& operator=(const CommandLine&) = delete;

    int argc() const { return static_cast<int>(_arguments.size()); }
    char* const* argv() const { return _pointers.data(); }

private:
    std::vector<std::string> _arguments;
    std::vector<char*> _pointers;
};
