#include "LibraryFixture.h"

namespace testsupport {

LoadedLibrary* LibraryFixture::lib = nullptr;

}  // namespace testsupport
