// A client's transaction, which gives its lock back on every way out.
#ifndef GSCL_GSTRANSACTION_H
#define GSCL_GSTRANSACTION_H

#include "gscl/GSClientData_internal.h"

namespace zelt_gscl_V1 {

/// end() is the regular end. Without it (the thread ends inside) the lock is given back silently.
class GSTransaction {
 public:
  explicit GSTransaction(GSClient* client) : client_(client) { client_->beginTransaction(); }
  ~GSTransaction() {
    if (open_) static_cast<GSxClientData*>(client_->_clData)->_transactionLock.WriteUnlock();
  }
  GSTransaction(const GSTransaction&) = delete;
  GSTransaction& operator=(const GSTransaction&) = delete;

  void end() {
    open_ = false;
    client_->endTransaction();
  }

 private:
  GSClient* client_;
  bool open_ = true;
};

}  // namespace zelt_gscl_V1

#endif
