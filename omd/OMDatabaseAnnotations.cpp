// The database's annotation entry points, serialised on _sync, and automatic election.
#include "Ombrel/OMLog.h"
#include "omd/OMDAnnotationStore.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDatabase.h"
#include "platform/Notify.h"

namespace om {

Value OMDatabase::annotationForPlugIn(const OMDPlugIn& plugIn) const
{
    Value annotation;
    _sync->sync([&] { annotation = m_annotations->annotationForPlugIn(plugIn); });
    return annotation;
}

void OMDatabase::setAnnotation(const Value& annotation, const OMDPlugIn& plugIn)
{
    _sync->sync([&] { m_annotations->setAnnotation(annotation, plugIn); });
}

void OMDatabase::notifyAnnotationChange()
{
    // Logged before the reply that follows it, so that a reader of the log can count what was posted.
    OMLog::ops().debug("posting %{public}s", kAnnotationChangeNotification);
    Notify::post(kAnnotationChangeNotification);
}

void OMDatabase::autoElect(const std::shared_ptr<OMDPlugIn>& plugIn)
{
    _sync->assertCurrent();
    // The store directly: the database's own entry points would enter _sync again.
    Value annotation = m_annotations->annotationForPlugIn(*plugIn);
    const Value& election = annotation["election"];
    if (!election.isNone() && !election.numericallyEquals(0))
        return;
    m_annotations->setAnnotation(Value::dictionary({ { "election", Value::integer(1) } }), *plugIn);
}

} // namespace om
