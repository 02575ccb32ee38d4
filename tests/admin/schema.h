// JSON as zq3hist-json(5) describes it.
#pragma once

#include <nlohmann/json.hpp>
#include <set>

#include "tests/support.h"

// What the manual lists for a command, as path -> types; the members that outputs had go into seen.
struct manualSection {
    std::map<std::string, std::string> members;
    std::set<std::string> seen;

    explicit manualSection(const std::string& command)
    {
        std::istringstream manual(slurp(ZQ3_MANUALS "/zq3hist-json.5"));
        std::string section;
        for (std::string line; std::getline(manual, line);)
            if (line.starts_with(".Ss "))
                section = line.substr(4);
            else if (size_t type = line.find(" Pq "); section == command && type < line.size())
                members[line.substr(strlen(".It Li "), type - strlen(".It Li "))] =
                    line.substr(type + strlen(" Pq "));
    }

    // Every member of an output must be listed with its type.
    void check(const nlohmann::json& value, const std::string& path = "")
    {
        if (value.is_object()) {
            for (const auto& [key, member] : value.items())
                check(member, path.empty() ? key : path + "." + key);
        } else if (value.is_array()) {
            for (const auto& element : value)
                check(element, path + "[]");
        } else {
            std::string type = value.is_string() ? "text" : value.type_name();
            EXPECT_TRUE((members[path] + " or").find(type) != std::string::npos)
                << path << ": " << type << ", not " << members[path];
            seen.insert(path);
        }
    }

    // Every member that is listed must have been in some output.
    ~manualSection()
    {
        EXPECT_FALSE(members.empty());
        for (const auto& [path, type] : members)
            EXPECT_TRUE(seen.contains(path)) << path;
    }
};
