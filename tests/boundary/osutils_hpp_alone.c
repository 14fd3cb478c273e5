/* A client of osutils.hpp alone. */
#include <osutils.hpp>
/* a second inclusion changes nothing */
#include <osutils.hpp>

#ifdef __cplusplus
static_assert(sizeof(osutils::Owned<char>) == sizeof(char*),
              "an owner is no larger than its pointer");
static_assert(sizeof(osutils::SharedLib) == sizeof(void*),
              "an owner is no larger than its pointer");
#endif
