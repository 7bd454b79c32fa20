#pragma once

namespace kel::platform {

/// The count of open work: while it is not zero the launcher does not end the process for being idle. Any
/// thread.
class Transactions {
 public:
  virtual ~Transactions() = default;
  virtual void open() = 0;
  virtual void close() = 0;
};

/// One piece of open work, from construction to destruction. A copy counts as one more, so that work held in
/// a queued task stays open until the task is gone.
class Transaction {
 public:
  explicit Transaction(Transactions& transactions) : transactions_(&transactions) { transactions_->open(); }
  Transaction(const Transaction& other) : Transaction(*other.transactions_) {}
  Transaction& operator=(const Transaction&) = delete;
  ~Transaction() { transactions_->close(); }

 private:
  Transactions* transactions_;
};

}  // namespace kel::platform
