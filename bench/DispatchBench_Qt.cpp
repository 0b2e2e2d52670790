// The row of DispatchBench.cpp for Qt, in a file of its own because of its code generator.
#include <benchmark/benchmark.h>

#include <QMetaObject>
#include <QObject>

class QtDeck : public QObject {
    Q_OBJECT
public:
    Q_INVOKABLE void Play() {}
    Q_INVOKABLE double Add(double value) { return m_Total += value; }
    Q_INVOKABLE void Stop() {}

private:
    double m_Total = 0;
};

void QtInvoke(benchmark::State& state);
void QtInvoke(benchmark::State& state) {
    QtDeck deck;
    for (auto _ : state) {
        double result = 0;
        QMetaObject::invokeMethod(&deck, "Add", Qt::DirectConnection, Q_RETURN_ARG(double, result),
                                  Q_ARG(double, 1.5));
        benchmark::DoNotOptimize(result);
    }
}

#include "DispatchBench_Qt.moc"
