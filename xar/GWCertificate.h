#pragma once
#include <GWArchiveSupport/GWCertificate.h>
