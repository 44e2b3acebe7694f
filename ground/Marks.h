// What tells our entries in a router's table from everybody else's. Relies on nothing.
#pragma once

namespace tavo {

// Every description that we give to a rule's mapping begins with this.
inline constexpr char kOwnPrefix[] = "tavo:";
// The same for the mappings that only test a router.
inline constexpr char kTestPrefix[] = "tavotest:";

}  // namespace tavo
