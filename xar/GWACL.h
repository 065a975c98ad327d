#pragma once
#include <GWArchiveSupport/GWACL.h>
