// The two places of router descriptions, seen as one: those that were downloaded, in the place that the library
// knows, and those that the box's owner wrote, which a refresh never touches.
// Relies on std::filesystem. Promises: the owner's description of a model and version comes before a downloaded one.
#pragma once

#include <filesystem>
#include <string>
#include <vector>

namespace tavo {

inline constexpr char kDatabase[] = "/etc.defaults/portforward/routerdb";
inline constexpr char kDatabaseAside[] = "/etc.defaults/portforward/routerdb.old";  // while a new one takes its place
inline constexpr char kOwnDatabase[] = "/etc/tavo/routerdb";

// The names of the directories in dir, sorted; throws when it cannot be read, for a list is whole or absent.
std::vector<std::string> Directories(const std::filesystem::path& dir);

// The old database back in its place, where a refresh that was killed left it aside.
void BringBackDatabase();

// The library looks for descriptions below kDatabase by path: what the owner wrote gets links there (database is
// kDatabase or what is about to take its place), and links whose description is gone go too. Without the right
// to write there, nothing happens.
void LinkOwnDescriptions(const std::filesystem::path& database);

}  // namespace tavo
