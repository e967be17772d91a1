// The whole public interface of libfileindex.
#ifndef FILEINDEX_FILEINDEX_H
#define FILEINDEX_FILEINDEX_H

#include <fileindex/config.h>
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/folder.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>

#endif
