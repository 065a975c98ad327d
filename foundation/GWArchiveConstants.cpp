#include "GWArchiveSupport/GWArchiveConstants.h"

const double GWArchiveSupportVersionNumber = 1.0;
const char* const GWArchiveSupportVersionString = "1.0";

const char* const kGWZipArchiveErrorDomain = "GWZipArchiveErrorDomain";
const char* const kGWZipArchiveUnknownEntityErrorKey = "GWZipArchiveUnknownEntityErrorKey";

const char* const kGWXARArchiveErrorDomain = "GWXARArchiveErrorDomain";
const char* const kGWXARArchiveUnknownEntityErrorKey = "GWXARArchiveUnknownEntityErrorKey";
const char* const kGWXARArchiveAffectedXMLNodeErrorKey = "GWXARArchiveAffectedXMLNodeErrorKey";
