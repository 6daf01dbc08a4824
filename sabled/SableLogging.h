#pragma once

#include "platform/Log.h"

namespace sable {

/// The daemon's logging categories; the index is the category's place in the table of handles.
enum SableLoggingCategory : unsigned {
  SableLoggingCategorySable,
  SableLoggingCategoryFeedback,
  SableLoggingCategorySession,
  SableLoggingCategoryRequest,
  SableLoggingCategoryFlusher,
  SableLoggingCategorySearch,
  SableLoggingCategoryZeroKeyword,
  SableLoggingCategoryMoreResults,
  SableLoggingCategoryCard,
  SableLoggingCategoryLookUp,
  SableLoggingCategoryFlight,
  SableLoggingCategoryImages,
  SableLoggingCategoryConnection,
  SableLoggingCategoryDownloadManager,
  SableLoggingCategoryBag,
  SableLoggingCategorySubscription,
  SableLoggingCategoryCaching,
  SableLoggingCategoryFeedbackErrors,
  SableLoggingCategoryFeedbackStorage,
  SableLoggingCategoryCount,
};

/// The log of a category; any thread, for the life of the process. A category that does not exist
/// is a programming error and stops the process.
const platform::LogHandle& SableLogForCategory(unsigned category);

/// The log for what belongs to no category.
const platform::LogHandle& SableDefaultLog();

}  // namespace sable
