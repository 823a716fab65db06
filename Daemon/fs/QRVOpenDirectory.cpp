#include "fs/QRVOpenDirectory.h"

// Opened for reading only: a failed close loses nothing.
QRVOpenDirectory::~QRVOpenDirectory() { files_->close(fd_); }
