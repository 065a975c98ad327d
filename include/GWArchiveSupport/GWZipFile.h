#pragma once

// A node of a ZIP archive's entry tree, and the keys of its extra info.

#include "zip/GWZipFile.h"
